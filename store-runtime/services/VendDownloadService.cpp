#include "store-runtime/services/VendDownloadService.h"

#include "platform/log/TillLogManager.h"
#include "store-runtime/download/VendDownloadManager.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "VendDownloadService";

}  // namespace

VendDownloadService::VendDownloadService(VendStoreClient storeClient,
                                         std::shared_ptr<VendRuntime> runtime)
    : storeClient_(std::move(storeClient)), runtime_(std::move(runtime)) {}

void VendDownloadService::performDownload(std::shared_ptr<TillDownload> download,
                                          std::int64_t options, PerformReply reply) {
  TILL_LOG(2, "%@: %@ asks for %@ (options %lld)", kSpeaker, storeClient_.identifier(), download,
           static_cast<long long>(options));
  runtime_->downloadManager().performDownload(
      std::move(download), [reply = std::move(reply)](bool success, OptionalError error) {
        if (reply) reply(success ? 1 : 0, std::move(error));
      });
}

void VendDownloadService::downloadsWithTypeMask(std::int64_t mask, DownloadsReply reply) {
  if (reply) reply(runtime_->downloadManager().downloadsWithTypeMask(mask));
}

void VendDownloadService::pauseDownloadWithItemIdentifier(std::uint64_t itemIdentifier) {
  runtime_->downloadManager().pauseDownloadWithItemIdentifier(itemIdentifier);
}

void VendDownloadService::resumeDownloadWithItemIdentifier(std::uint64_t itemIdentifier) {
  runtime_->downloadManager().resumeDownloadWithItemIdentifier(itemIdentifier);
}

void VendDownloadService::checkPreflightWithItemIdentifier(std::uint64_t itemIdentifier,
                                                           std::string url,
                                                           PlistValue systemVersionInfo,
                                                           PreflightReply reply) {
  runtime_->downloadManager().checkPreflight(itemIdentifier, std::move(url),
                                             std::move(systemVersionInfo), std::move(reply));
}

void VendDownloadService::lockApplicationsForBundleID(std::string bundleIdentifier) {
  runtime_->downloadManager().lockApplicationsForBundleID(bundleIdentifier);
}

void VendDownloadService::unlockApplicationsWithBundleIdentifier(std::string bundleIdentifier) {
  runtime_->downloadManager().unlockApplicationsWithBundleIdentifier(bundleIdentifier);
}

}  // namespace larder
