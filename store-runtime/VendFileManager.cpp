#include "store-runtime/VendFileManager.h"

#include <unistd.h>

#include <filesystem>

#include "platform/Environment.h"
#include "platform/FileIO.h"

namespace larder {

bool VendFileManager::isUpdatableAtPath(const std::string& path) {
  std::error_code code;
  if (!std::filesystem::is_directory(path, code)) return false;
  std::string parent = std::filesystem::path(path).parent_path().string();
  return ::access(path.c_str(), W_OK) == 0 && ::access(parent.c_str(), W_OK) == 0;
}

std::string VendFileManager::cacheDirectoryPathWithName(std::string_view name) {
  std::string path = Environment::cacheHome() + "/" + std::string(name);
  FileIO::createDirectories(path);
  return path;
}

std::string VendFileManager::volumePath(std::string_view path) {
  std::string volumes = Environment::rootedPath("/Volumes/");
  if (path.size() <= volumes.size() || path.substr(0, volumes.size()) != volumes) return "/";
  std::string_view rest = path.substr(volumes.size());
  std::size_t slash = rest.find('/');
  return volumes + std::string(rest.substr(0, slash));
}

namespace {

bool isDigit(char c) {
  return c >= '0' && c <= '9';
}

// Compares two runs of digits as numbers of any length.
int compareDigitRuns(std::string_view a, std::string_view b) {
  while (a.size() > 1 && a.front() == '0') a.remove_prefix(1);
  while (b.size() > 1 && b.front() == '0') b.remove_prefix(1);
  if (a.size() != b.size()) return a.size() < b.size() ? -1 : 1;
  int order = a.compare(b);
  return order < 0 ? -1 : (order > 0 ? 1 : 0);
}

std::string_view takeDigits(std::string_view text, std::size_t& index) {
  std::size_t start = index;
  while (index < text.size() && isDigit(text[index])) ++index;
  return text.substr(start, index - start);
}

}  // namespace

int compareVersionStrings(std::string_view a, std::string_view b) {
  std::size_t i = 0;
  std::size_t j = 0;
  while (i < a.size() && j < b.size()) {
    if (isDigit(a[i]) && isDigit(b[j])) {
      int order = compareDigitRuns(takeDigits(a, i), takeDigits(b, j));
      if (order != 0) return order;
      continue;
    }
    if (a[i] != b[j])
      return static_cast<unsigned char>(a[i]) < static_cast<unsigned char>(b[j]) ? -1 : 1;
    ++i;
    ++j;
  }
  if (i < a.size()) return 1;
  if (j < b.size()) return -1;
  return 0;
}

}  // namespace larder
