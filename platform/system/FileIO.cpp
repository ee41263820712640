#include "platform/system/FileIO.h"

#include "platform/system/FileDescriptor.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <csignal>
#include <cstring>
#include <filesystem>
#include <random>
#include <string_view>
#include <utility>

namespace larder {

namespace {

// The failure of a system call, by the errno it left.
VendError systemError(const std::string& what) {
  const int code = errno;
  return VendError::withDomain(std::string(FileIO::kErrorDomain), code,
                               what + ": " + std::strerror(code));
}

VendError fileError(std::int64_t code, std::string description) {
  return VendError::withDomain(std::string(FileIO::kErrorDomain), code, std::move(description));
}

bool writeAll(int fd, std::span<const std::uint8_t> bytes) {
  while (!bytes.empty()) {
    ssize_t written = ::write(fd, bytes.data(), bytes.size());
    if (written < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    bytes = bytes.subspan(static_cast<std::size_t>(written));
  }
  return true;
}

constexpr std::string_view kTemporaryInfix = ".tmp-";

std::string temporarySibling(const std::string& path) {
  thread_local std::mt19937_64 generator{std::random_device{}()};
  return path + std::string(kTemporaryInfix) + std::to_string(::getpid()) + "-" +
         std::to_string(generator());
}

// The process id in a temporary sibling's name ("NAME.tmp-PID-RANDOM"), or
// nullopt when `name` is not one of `base`'s.
std::optional<pid_t> writerOfTemporary(std::string_view name, std::string_view base) {
  if (!name.starts_with(base)) return std::nullopt;
  name.remove_prefix(base.size());
  if (!name.starts_with(kTemporaryInfix)) return std::nullopt;
  name.remove_prefix(kTemporaryInfix.size());
  const auto dash = name.find('-');
  if (dash == std::string_view::npos || dash + 1 == name.size()) return std::nullopt;
  const std::string_view random = name.substr(dash + 1);
  if (!std::ranges::all_of(random, [](char c) { return c >= '0' && c <= '9'; })) {
    return std::nullopt;
  }
  pid_t pid = 0;
  const auto [end, code] = std::from_chars(name.data(), name.data() + dash, pid);
  if (code != std::errc{} || end != name.data() + dash || pid <= 0) return std::nullopt;
  return pid;
}

bool isStaleWriter(pid_t pid) {
  return pid == ::getpid() || (::kill(pid, 0) != 0 && errno == ESRCH);
}

void syncParentDirectory(const std::string& path) {
  std::string parent = std::filesystem::path(path).parent_path().string();
  FileDescriptor directory(::open(parent.empty() ? "." : parent.c_str(), O_RDONLY | O_DIRECTORY));
  if (directory.valid()) ::fsync(directory.get());
}

}  // namespace

Result<std::vector<std::uint8_t>> FileIO::read(const std::string& path, std::size_t maxBytes) {
  FileDescriptor file(
      ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));  // a FIFO never blocks
  if (!file.valid()) return systemError("open " + path);
  struct stat info {};
  if (::fstat(file.get(), &info) != 0 || !S_ISREG(info.st_mode)) {
    return fileError(EINVAL, path + " is not a regular file");
  }
  std::vector<std::uint8_t> contents;
  contents.reserve(static_cast<std::size_t>(info.st_size));
  std::uint8_t buffer[65536];
  for (;;) {
    ssize_t count = ::read(file.get(), buffer, sizeof buffer);
    if (count < 0) {
      if (errno == EINTR) continue;
      return systemError("read " + path);
    }
    if (count == 0) break;
    if (contents.size() + static_cast<std::size_t>(count) > maxBytes) {
      return fileError(EFBIG, path + " is larger than " + std::to_string(maxBytes) + " bytes");
    }
    contents.insert(contents.end(), buffer, buffer + count);
  }
  return contents;
}

Result<void> FileIO::createDirectories(const std::string& path) {
  std::error_code code;
  std::filesystem::create_directories(path, code);
  if (code && !std::filesystem::is_directory(path)) {
    return fileError(code.value(), "create " + path + ": " + code.message());
  }
  return {};
}

namespace {

FileIdentity identityOf(const struct stat& status) {
  return {
      static_cast<std::uint64_t>(status.st_dev), static_cast<std::uint64_t>(status.st_ino),
      static_cast<std::uint64_t>(status.st_size),
      static_cast<std::int64_t>(status.st_mtim.tv_sec) * 1'000'000'000 + status.st_mtim.tv_nsec};
}

}  // namespace

std::optional<FileIdentity> FileIO::identity(const std::string& path) {
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0) return std::nullopt;
  return identityOf(status);
}

Result<void> FileIO::writeAtomically(const std::string& path, std::span<const std::uint8_t> bytes,
                                     FileIdentity* written) {
  std::string parent = std::filesystem::path(path).parent_path().string();
  if (!parent.empty()) {
    if (auto created = createDirectories(parent); !created) return created;
  }
  std::string temporary = temporarySibling(path);
  FileDescriptor file(
      ::open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, S_IRUSR | S_IWUSR));
  if (!file.valid()) return systemError("create " + temporary);
  if (!writeAll(file.get(), bytes) || ::fsync(file.get()) != 0) {
    VendError failure = systemError("write " + temporary);
    ::unlink(temporary.c_str());
    return failure;
  }
  // The rename keeps the inode, the size and the modification time.
  struct stat status {};
  if (written != nullptr && ::fstat(file.get(), &status) != 0) {
    VendError failure = systemError("stat " + temporary);
    ::unlink(temporary.c_str());
    return failure;
  }
  if (written != nullptr) *written = identityOf(status);
  if (::close(file.release()) != 0 || ::rename(temporary.c_str(), path.c_str()) != 0) {
    VendError failure = systemError("replace " + path);
    ::unlink(temporary.c_str());
    return failure;
  }
  syncParentDirectory(path);
  return {};
}

Result<void> FileIO::writeInPlace(const std::string& path, std::span<const std::uint8_t> bytes) {
  std::string parent = std::filesystem::path(path).parent_path().string();
  if (!parent.empty()) {
    if (auto created = createDirectories(parent); !created) return created;
  }
  FileDescriptor file(
      ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, S_IRUSR | S_IWUSR));
  if (!file.valid()) return systemError("open " + path);
  if (!writeAll(file.get(), bytes)) return systemError("write " + path);
  if (::close(file.release()) != 0) return systemError("close " + path);
  return {};
}

std::size_t FileIO::removeStaleTemporaries(const std::string& path) {
  const std::filesystem::path target(path);
  const std::string base = target.filename().string();
  std::error_code code;
  std::filesystem::directory_iterator entries(
      target.has_parent_path() ? target.parent_path() : std::filesystem::path("."), code);
  std::size_t removed = 0;
  for (; !code && entries != std::filesystem::directory_iterator(); entries.increment(code)) {
    const std::string name = entries->path().filename().string();
    const std::optional<pid_t> writer = writerOfTemporary(name, base);
    if (!writer || !isStaleWriter(*writer)) continue;
    std::error_code removal;
    if (std::filesystem::remove(entries->path(), removal)) ++removed;
  }
  return removed;
}

Result<void> FileIO::writeAtomically(const std::string& path, std::string_view text) {
  return writeAtomically(
      path, std::span(reinterpret_cast<const std::uint8_t*>(text.data()), text.size()));
}

}  // namespace larder
