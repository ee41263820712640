#include "store-runtime/core/VendStringHelpers.h"

#include <cctype>
#include <charconv>

#include <pwd.h>
#include <unistd.h>

#include <optional>
#include <vector>

namespace larder {

namespace {

constexpr std::size_t kPasswordBufferBytes = 16384;

std::optional<std::string> homeFromEntry(int lookupResult, const passwd* found) {
  if (lookupResult != 0 || !found || !found->pw_dir || found->pw_dir[0] == '\0') {
    return std::nullopt;
  }
  return std::string(found->pw_dir);
}

std::optional<std::string> homeOfCurrentUser() {
  std::vector<char> buffer(kPasswordBufferBytes);
  passwd entry{};
  passwd* found = nullptr;
  int result = ::getpwuid_r(::getuid(), &entry, buffer.data(), buffer.size(), &found);
  return homeFromEntry(result, found);
}

std::optional<std::string> homeOfUser(const std::string& name) {
  std::vector<char> buffer(kPasswordBufferBytes);
  passwd entry{};
  passwd* found = nullptr;
  int result = ::getpwnam_r(name.c_str(), &entry, buffer.data(), buffer.size(), &found);
  return homeFromEntry(result, found);
}

std::string withoutTrailingSlash(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path;
}

}  // namespace

std::string stringByExpandingTildeInPathOutsideOfSandbox(std::string_view path) {
  if (path.empty() || path.front() != '~') return std::string(path);
  std::size_t slash = path.find('/');
  std::string_view userName =
      path.substr(1, slash == std::string_view::npos ? path.npos : slash - 1);
  std::string_view rest = slash == std::string_view::npos ? std::string_view() : path.substr(slash);
  std::optional<std::string> home =
      userName.empty() ? homeOfCurrentUser() : homeOfUser(std::string(userName));
  if (!home) return std::string(path);
  std::string expanded = withoutTrailingSlash(*home);
  if (expanded == "/" && !rest.empty()) expanded.clear();
  return expanded + std::string(rest);
}

std::string urlByAddingStringToQueryString(std::string_view url, std::string_view text) {
  while (!text.empty() && (text.front() == '?' || text.front() == '&')) text.remove_prefix(1);
  if (text.empty()) return std::string(url);
  std::size_t hash = url.find('#');
  std::string_view base = url.substr(0, hash);
  std::string_view fragment =
      hash == std::string_view::npos ? std::string_view() : url.substr(hash);
  std::string result(base);
  if (base.find('?') == std::string_view::npos) {
    result += '?';
  } else if (!base.empty() && base.back() != '?' && base.back() != '&') {
    result += '&';
  }
  result += text;
  result += fragment;
  return result;
}

std::string percentEncodedQueryComponent(std::string_view text) {
  static constexpr char kDigits[] = "0123456789ABCDEF";
  std::string encoded;
  encoded.reserve(text.size());
  for (const unsigned char byte : text) {
    if (std::isalnum(byte) != 0 || byte == '-' || byte == '_' || byte == '.' || byte == '~') {
      encoded.push_back(static_cast<char>(byte));
    } else {
      encoded.push_back('%');
      encoded.push_back(kDigits[byte >> 4U]);
      encoded.push_back(kDigits[byte & 0xFU]);
    }
  }
  return encoded;
}

std::string hexString(std::span<const std::uint8_t> bytes) {
  static constexpr char kDigits[] = "0123456789abcdef";
  std::string text;
  text.reserve(bytes.size() * 2);
  for (const std::uint8_t byte : bytes) {
    text.push_back(kDigits[byte >> 4U]);
    text.push_back(kDigits[byte & 0xFU]);
  }
  return text;
}

int hexDigitValue(char digit) {
  if (digit >= '0' && digit <= '9') return digit - '0';
  if (digit >= 'a' && digit <= 'f') return digit - 'a' + 10;
  if (digit >= 'A' && digit <= 'F') return digit - 'A' + 10;
  return -1;
}

std::optional<std::uint64_t> unsignedDecimalNumber(std::string_view text) {
  if (text.empty()) return std::nullopt;
  std::uint64_t value = 0;
  const char* end = text.data() + text.size();
  const auto [stop, code] = std::from_chars(text.data(), end, value);
  if (code != std::errc() || stop != end) return std::nullopt;
  return value;
}

}  // namespace larder
