#pragma once

#include <cstdint>

#include "larder-store/StoreCloudLibrary.h"
#include "platform/value/PlistValue.h"

namespace larder {

// The DMAP documents of the cloud library routes. Each carries the status
// 200 (`mstt`) like the protocol's answers do.
class StoreDAAPAnswers {
 public:
  // `mlog`: the session id (`mlid`).
  static PlistData login(std::uint32_t sessionID);
  // `mupd`: the library's revision (`musr`).
  static PlistData update(std::uint32_t revision);
  // `avdb`: one database, the library, with its item count.
  static PlistData databases(std::uint32_t revision, std::size_t itemCount);
  // `adbs`: the items (`mlcl`) and the deleted ids (`mudl`), with the
  // update type (`muty`: 0 for the whole library, 1 for a difference).
  static PlistData items(const StoreCloudLibrary::Changes& changes);

  static constexpr std::uint64_t kLibraryDatabaseID = 1;
};

}  // namespace larder
