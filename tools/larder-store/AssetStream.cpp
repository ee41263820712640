#include "larder-store/AssetStream.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <span>

namespace larder {

std::shared_ptr<AssetStream> AssetStream::open(const std::string& path, Damage damage) {
  FileDescriptor file(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  struct stat status {};
  if (!file.valid() || ::fstat(file.get(), &status) != 0 || !S_ISREG(status.st_mode)) {
    return nullptr;
  }
  ::posix_fadvise(file.get(), 0, 0, POSIX_FADV_SEQUENTIAL);
  return std::make_shared<AssetStream>(file.release(), static_cast<std::uint64_t>(status.st_size),
                                       damage);
}

AssetStream::AssetStream(int fd, std::uint64_t size, Damage damage)
    : file_(fd), size_(size), damage_(damage), buffer_(kBlockSize) {}

bool AssetStream::provide(std::size_t offset, std::size_t length, httplib::DataSink& sink) {
  if (damage_ == Damage::Truncate && !truncateAt_) truncateAt_ = offset + length / 2;
  std::size_t wanted = std::min(length, buffer_.size());
  if (truncateAt_) {
    if (offset >= *truncateAt_) return false;
    wanted = std::min<std::size_t>(wanted, *truncateAt_ - offset);
  }
  ssize_t got = 0;
  do {
    got = ::pread(file_.get(), buffer_.data(), wanted, static_cast<off_t>(offset));
  } while (got < 0 && errno == EINTR);
  if (got <= 0) return false;  // the file shrank or cannot be read: end the answer
  const std::span<char> block(buffer_.data(), static_cast<std::size_t>(got));
  if (damage_ == Damage::Corrupt) corrupt(offset, block);
  return sink.write(block.data(), block.size());
}

void AssetStream::corrupt(std::uint64_t offset, std::span<char> bytes) const {
  const std::uint64_t first = size_ / 2;
  const std::uint64_t last = std::min(size_, first + kCorruptedBytes);
  for (std::uint64_t position = std::max(first, offset);
       position < std::min(last, offset + bytes.size()); ++position) {
    bytes[position - offset] = static_cast<char>(~bytes[position - offset]);
  }
}

}  // namespace larder
