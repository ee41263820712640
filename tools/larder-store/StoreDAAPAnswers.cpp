#include "larder-store/StoreDAAPAnswers.h"

#include <algorithm>
#include <cstdint>

#include "dmap/DAAPBuffer.h"
#include "dmap/DAAPCode.h"
#include "dmap/DAAPContainerScope.h"

namespace larder {
namespace {

constexpr std::uint32_t kStatusOK = 200;
constexpr std::string_view kLibraryName = "Cloud Library";

std::uint32_t count32(std::size_t count) {
  return static_cast<std::uint32_t>(std::min<std::size_t>(count, UINT32_MAX));
}

}  // namespace

PlistData StoreDAAPAnswers::login(std::uint32_t sessionID) {
  DAAPBuffer buffer;
  {
    DAAPContainerScope document(buffer, "mlog"_dmap);
    buffer.appendUInt32(kStatusOK, "mstt"_dmap);
    buffer.appendUInt32(sessionID, "mlid"_dmap);
  }
  return buffer.takeData();
}

PlistData StoreDAAPAnswers::update(std::uint32_t revision) {
  DAAPBuffer buffer;
  {
    DAAPContainerScope document(buffer, "mupd"_dmap);
    buffer.appendUInt32(kStatusOK, "mstt"_dmap);
    buffer.appendUInt32(revision, "musr"_dmap);
  }
  return buffer.takeData();
}

PlistData StoreDAAPAnswers::databases(std::uint32_t revision, std::size_t itemCount) {
  DAAPBuffer buffer;
  {
    DAAPContainerScope document(buffer, "avdb"_dmap);
    buffer.appendUInt32(kStatusOK, "mstt"_dmap);
    buffer.appendUInt8(0, "muty"_dmap);
    buffer.appendUInt32(1, "mtco"_dmap);
    buffer.appendUInt32(1, "mrco"_dmap);
    buffer.appendUInt32(revision, "musr"_dmap);
    DAAPContainerScope listing(buffer, "mlcl"_dmap);
    DAAPContainerScope database(buffer, "mlit"_dmap);
    buffer.appendUInt64(kLibraryDatabaseID, "miid"_dmap);
    buffer.appendUInt64(kLibraryDatabaseID, "mper"_dmap);
    buffer.appendUTF8String(kLibraryName, "minm"_dmap);
    buffer.appendUInt32(count32(itemCount), "mimc"_dmap);
    buffer.appendUInt32(0, "mctc"_dmap);
  }
  return buffer.takeData();
}

PlistData StoreDAAPAnswers::items(const StoreCloudLibrary::Changes& changes) {
  DAAPBuffer buffer;
  {
    DAAPContainerScope document(buffer, "adbs"_dmap);
    buffer.appendUInt32(kStatusOK, "mstt"_dmap);
    buffer.appendUInt8(changes.full ? 0 : 1, "muty"_dmap);
    buffer.appendUInt32(count32(changes.totalCount), "mtco"_dmap);
    buffer.appendUInt32(count32(changes.items.size()), "mrco"_dmap);
    buffer.appendUInt32(changes.revision, "musr"_dmap);
    {
      DAAPContainerScope listing(buffer, "mlcl"_dmap);
      for (const StoreLibraryItem& item : changes.items) item.writeTo(buffer);
    }
    DAAPContainerScope deleted(buffer, "mudl"_dmap);
    for (const std::uint64_t identifier : changes.deleted) {
      buffer.appendUInt64(identifier, "mild"_dmap);
    }
  }
  return buffer.takeData();
}

}  // namespace larder
