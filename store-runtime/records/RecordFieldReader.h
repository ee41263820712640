#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/plist/KeyedArchive.h"
#include "platform/value/PlistValue.h"

namespace larder {

// Reads the fields of a record's dictionary, archive or wire form alike.
// A value of the wrong type reads as absent and clears `ok()`, so that the
// record can refuse itself as a whole instead of half-filling; a missing
// key is never a failure. Values come from files and from other processes,
// so every reader also refuses what its type cannot hold (a negative
// identifier, a date that is not a finite number).
//
// A converting reader takes what another sender may well mean: a number
// where text is expected reads as its decimal text, date text in ISO 8601
// form as a date, "true" or "NO" as a boolean, an integral real or integer
// text as an integer. What still cannot be read fails as above.
class RecordFieldReader {
 public:
  enum class Reading { kExact, kConverting };

  explicit RecordFieldReader(const PlistDictionary& source, Reading reading = Reading::kExact)
      : source_(source), converting_(reading == Reading::kConverting) {}
  // A value that is not a dictionary reads as an empty, failed record.
  explicit RecordFieldReader(const PlistValue& source);

  // The record `readFields` makes of a wire form; nullopt when a field has
  // the wrong type.
  template <typename Record>
  static std::optional<Record> read(const PlistDictionary& source,
                                    Record (*readFields)(RecordFieldReader&)) {
    RecordFieldReader reader(source);
    return reader.finish(readFields(reader));
  }
  // The same of a keyed-archive form; nullopt also when its "$class" is
  // not `className`.
  template <typename Record>
  static std::optional<Record> unarchive(const PlistValue& encoded, std::string_view className,
                                         Record (*readFields)(RecordFieldReader&)) {
    if (KeyedArchive::classNameOf(encoded) != className) return std::nullopt;
    RecordFieldReader reader(encoded);
    return reader.finish(readFields(reader));
  }

  std::optional<std::string> string(std::string_view key);
  // Integers only: a real or a string is not a count or a code.
  std::optional<std::int64_t> integer(std::string_view key);
  // Non-negative integers only: identifiers, sizes, tokens.
  std::optional<std::uint64_t> unsignedInteger(std::string_view key);
  // Any finite number.
  std::optional<double> real(std::string_view key);
  // Booleans, and integers as C does (non-zero is true).
  std::optional<bool> boolean(std::string_view key);
  // A date, or a finite number of seconds since 1970: dates cross the bus as
  // doubles.
  std::optional<PlistDate> date(std::string_view key);
  std::optional<PlistDictionary> dictionary(std::string_view key);
  // Every element must be a string.
  std::optional<std::vector<std::string>> strings(std::string_view key);
  // Whatever is stored, unchecked; absent is the null value.
  [[nodiscard]] const PlistValue& value(std::string_view key) const;

  [[nodiscard]] bool ok() const { return ok_; }
  // For checks the reader cannot know, such as a required key.
  void fail() { ok_ = false; }

 private:
  template <typename Record>
  std::optional<Record> finish(Record record) const {
    if (!ok_) return std::nullopt;
    return record;
  }
  template <typename T>
  std::optional<T> refuse() {
    ok_ = false;
    return std::nullopt;
  }

  const PlistDictionary& source_;
  bool converting_ = false;
  bool ok_ = true;
};

}  // namespace larder
