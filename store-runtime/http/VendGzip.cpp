#include "store-runtime/http/VendGzip.h"

#include <zlib.h>

#include <algorithm>
#include <limits>

namespace larder {

namespace {

// windowBits above 15 select the gzip wrapper instead of zlib's own.
constexpr int kGzipWindowBits = 15 + 16;
constexpr int kMemoryLevel = 8;
constexpr std::size_t kChunkBytes = 64u * 1024u;

// zlib counts in uInt; feed larger inputs in pieces.
uInt nextInputPiece(std::size_t remaining) {
  return static_cast<uInt>(std::min<std::size_t>(remaining, std::numeric_limits<uInt>::max()));
}

// Owns a z_stream set up for one direction and ends it once.
class ZStream {
 public:
  enum class Direction { Deflate, Inflate };

  explicit ZStream(Direction direction) : direction_(direction) {
    int status = direction == Direction::Deflate
                     ? deflateInit2(&stream_, Z_DEFAULT_COMPRESSION, Z_DEFLATED, kGzipWindowBits,
                                    kMemoryLevel, Z_DEFAULT_STRATEGY)
                     : inflateInit2(&stream_, kGzipWindowBits);
    ready_ = status == Z_OK;
  }
  ~ZStream() {
    if (!ready_) return;
    if (direction_ == Direction::Deflate) {
      deflateEnd(&stream_);
    } else {
      inflateEnd(&stream_);
    }
  }
  ZStream(const ZStream&) = delete;
  ZStream& operator=(const ZStream&) = delete;

  [[nodiscard]] bool ready() const { return ready_; }
  z_stream& get() { return stream_; }

 private:
  Direction direction_;
  z_stream stream_{};
  bool ready_ = false;
};

}  // namespace

std::optional<PlistData> VendCopyGzippedDataForData(std::span<const std::uint8_t> data) {
  ZStream zstream(ZStream::Direction::Deflate);
  if (!zstream.ready()) return std::nullopt;
  z_stream& stream = zstream.get();
  PlistData output;
  std::size_t consumed = 0;
  int status = Z_OK;
  do {
    std::size_t remaining = data.size() - consumed;
    stream.next_in = const_cast<Bytef*>(data.data() + consumed);  // zlib does not write input
    stream.avail_in = nextInputPiece(remaining);
    uInt offered = stream.avail_in;
    int flush = offered == remaining ? Z_FINISH : Z_NO_FLUSH;
    do {
      std::size_t before = output.size();
      output.resize(before + kChunkBytes);
      stream.next_out = output.data() + before;
      stream.avail_out = static_cast<uInt>(kChunkBytes);
      status = deflate(&stream, flush);
      if (status == Z_STREAM_ERROR) return std::nullopt;
      output.resize(before + kChunkBytes - stream.avail_out);
    } while (stream.avail_out == 0);
    consumed += offered - stream.avail_in;
  } while (status != Z_STREAM_END);
  return output;
}

std::optional<PlistData> VendCopyGunzippedDataForData(std::span<const std::uint8_t> data,
                                                      std::size_t maxOutputBytes) {
  if (data.empty()) return std::nullopt;
  ZStream zstream(ZStream::Direction::Inflate);
  if (!zstream.ready()) return std::nullopt;
  z_stream& stream = zstream.get();
  PlistData output;
  std::size_t consumed = 0;
  int status = Z_OK;
  while (status != Z_STREAM_END) {
    if (stream.avail_in == 0) {
      if (consumed == data.size()) return std::nullopt;  // truncated
      stream.next_in = const_cast<Bytef*>(data.data() + consumed);
      stream.avail_in = nextInputPiece(data.size() - consumed);
      consumed += stream.avail_in;
    }
    std::size_t before = output.size();
    // One byte beyond the limit is enough to tell that the limit was passed.
    std::size_t allowance = maxOutputBytes - before;
    std::size_t room = allowance >= kChunkBytes ? kChunkBytes : allowance + 1;
    output.resize(before + room);
    stream.next_out = output.data() + before;
    stream.avail_out = static_cast<uInt>(room);
    status = inflate(&stream, Z_NO_FLUSH);
    output.resize(before + room - stream.avail_out);
    if (status == Z_BUF_ERROR && stream.avail_in == 0) continue;  // wants the next input piece
    if (status != Z_OK && status != Z_STREAM_END) return std::nullopt;
    if (output.size() > maxOutputBytes) return std::nullopt;
  }
  // Exactly one stream: bytes after its end are refused rather than ignored.
  if (stream.avail_in != 0 || consumed != data.size()) return std::nullopt;
  return output;
}

}  // namespace larder
