#include "dmap/DAAPTagReader.h"

#include "dmap/DAAPCode.h"
#include "platform/log/TillLogManager.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "DAAPParser";

}  // namespace

void DAAPTagReader::reportOverrun(std::uint32_t code, std::uint32_t length) const {
  TILL_LOG(3, "%@: tag '%@' claims %lu bytes, but its container has %lu left; rest skipped",
           kSpeaker, DAAPCode::text(code), length, rest_.size() - kHeaderSize);
}

void DAAPTagReader::reportStrayBytes() const {
  TILL_LOG(3, "%@: %lu stray bytes at the end of a container skipped", kSpeaker, rest_.size());
}

}  // namespace larder
