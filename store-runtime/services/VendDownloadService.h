#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/error/VendError.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/core/VendStoreClient.h"
#include "store-runtime/records/TillDownload.h"
#include "store-runtime/runtime/VendRuntime.h"

namespace larder {

// The download service of one store client: the client's view of the
// process's download layer. Replies come on the layer's threads; callers
// do their own locking.
class VendDownloadService {
 public:
  // 1 success, 0 failure.
  using PerformReply = std::function<void(std::int64_t result, OptionalError error)>;
  using DownloadsReply = std::function<void(std::vector<std::shared_ptr<TillDownload>>)>;
  using PreflightReply = std::function<void(bool allowed, PlistValue object)>;

  VendDownloadService(VendStoreClient storeClient, std::shared_ptr<VendRuntime> runtime);

  [[nodiscard]] const VendStoreClient& storeClient() const { return storeClient_; }

  // `options` has no defined bits; it is logged and otherwise ignored.
  void performDownload(std::shared_ptr<TillDownload> download, std::int64_t options,
                       PerformReply reply);
  void downloadsWithTypeMask(std::int64_t mask, DownloadsReply reply);
  void pauseDownloadWithItemIdentifier(std::uint64_t itemIdentifier);
  void resumeDownloadWithItemIdentifier(std::uint64_t itemIdentifier);
  // No system version info (null) compares with this machine's version.
  void checkPreflightWithItemIdentifier(std::uint64_t itemIdentifier, std::string url,
                                        PlistValue systemVersionInfo, PreflightReply reply);
  void lockApplicationsForBundleID(std::string bundleIdentifier);
  void unlockApplicationsWithBundleIdentifier(std::string bundleIdentifier);

 private:
  VendStoreClient storeClient_;
  std::shared_ptr<VendRuntime> runtime_;
};

}  // namespace larder
