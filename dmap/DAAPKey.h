#pragma once

#include <compare>
#include <string>
#include <string_view>

namespace larder {

// Key of a DMAP dictionary. The parsers store every value under one of a
// few hundred keys compiled into the program; borrowing that text instead of
// copying it saves an allocation for most stored values, since nearly all
// keys are too long for the short-string buffer. Keys that come off the
// wire (an `mdcl` pair, an embedded property list) own their text.
class DAAPKey {
 public:
  DAAPKey() = default;
  explicit DAAPKey(std::string text) : owned_(std::move(text)) {}
  explicit DAAPKey(std::string_view text) : owned_(text) {}
  explicit DAAPKey(const char* text) : owned_(text) {}

  // `text` must outlive every copy of the key: string literals and other
  // text with static storage duration only.
  static DAAPKey literal(std::string_view text) noexcept {
    DAAPKey key;
    key.borrowed_ = text.data();
    key.borrowedSize_ = text.size();
    return key;
  }

  [[nodiscard]] std::string_view view() const noexcept {
    return borrowed_ ? std::string_view(borrowed_, borrowedSize_) : std::string_view(owned_);
  }
  [[nodiscard]] std::string str() const { return std::string(view()); }
  [[nodiscard]] bool isBorrowed() const noexcept { return borrowed_ != nullptr; }

  friend bool operator==(const DAAPKey& a, const DAAPKey& b) { return a.view() == b.view(); }
  friend bool operator==(const DAAPKey& a, std::string_view b) { return a.view() == b; }
  friend std::strong_ordering operator<=>(const DAAPKey& a, const DAAPKey& b) {
    return a.view() <=> b.view();
  }
  friend std::strong_ordering operator<=>(const DAAPKey& a, std::string_view b) {
    return a.view() <=> b;
  }

  // For log lines: "%@" describes its argument.
  [[nodiscard]] std::string description() const { return str(); }

 private:
  const char* borrowed_ = nullptr;
  std::size_t borrowedSize_ = 0;
  std::string owned_;
};

}  // namespace larder
