#pragma once

#include <functional>
#include <string>
#include <string_view>

#include "platform/error/Result.h"
#include "platform/value/PlistValue.h"

namespace larder {

// A property-list file that holds the state of a facility this platform
// does not have (deferred-install agent, launcher bar, privileged helper...).
// The service, the command-line tool and tests may change one file from
// several processes at once, so every change is a read-modify-write under an
// exclusive lock on "<file>.lock" and lands with an atomic rename: a reader
// sees the old or the new state, never a torn one.
class PlatformStateFile {
 public:
  // How the file is written; reads take either. XML is for files people
  // read and write by hand; binary for files read often, whose parse must
  // be cheap.
  enum class Format { Xml, Binary };

  explicit PlatformStateFile(std::string path, Format format = Format::Xml)
      : path_(std::move(path)), format_(format) {}

  // "<root>/var/lib/larder-platform/<name>".
  static std::string pathForName(std::string_view name);
  static PlatformStateFile named(std::string_view name) {
    return PlatformStateFile(pathForName(name));
  }

  [[nodiscard]] const std::string& path() const { return path_; }

  // The stored value; null when the file is missing or damaged.
  [[nodiscard]] PlistValue read() const;
  // The stored dictionary; empty when missing, damaged or of another type.
  [[nodiscard]] PlistDictionary readDictionary() const;

  // Hands the current value (null when there is none) to `change` and
  // stores what it leaves; the error says why the lock or the write failed.
  Result<void> update(const std::function<void(PlistValue&)>& change) const;

  // Hands the current dictionary (empty when there is none) to `change`
  // and stores what it leaves. False when the lock or the write failed.
  bool updateDictionary(const std::function<void(PlistDictionary&)>& change) const;
  // The same for a value of any type (null when there is none).
  bool updateValue(const std::function<void(PlistValue&)>& change) const;

 private:
  std::string path_;
  Format format_;
};

}  // namespace larder
