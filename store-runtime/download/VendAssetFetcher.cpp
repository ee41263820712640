#include "store-runtime/download/VendAssetFetcher.h"

#include <curl/curl.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cmath>
#include <cstring>
#include <filesystem>

#include "platform/log/TillLogManager.h"
#include "store-runtime/download/VendAssetFileWriter.h"
#include "store-runtime/download/VendDownloadError.h"
#include "store-runtime/http/VendHTTPTransfer.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "VendAssetFetcher";
// What a download must leave free on its file system, for the install that
// follows and for everything else kept there.
constexpr std::uint64_t kSpareBytes = 64u << 20u;

VendURLRequest requestFor(const TillDownloadAsset& asset,
                          const VendAssetFetcher::Settings& settings) {
  VendURLRequest request = asset.URLRequest();
  if (request.timeoutInterval() == VendURLRequest::kDefaultTimeoutInterval) {
    request.setTimeoutInterval(settings.requestTimeout);
  }
  return request;
}

// What the transport's failure means for people.
VendError transferError(const VendURLRequest& request, const VendError& transport) {
  std::string what;
  switch (transport.code) {
    case CURLE_COULDNT_CONNECT:
      what = "the store refused the connection";
      break;
    case CURLE_OPERATION_TIMEDOUT:
      what = "the store sent nothing for " +
             std::to_string(std::lround(request.timeoutInterval())) + " seconds";
      break;
    case CURLE_PARTIAL_FILE:
      what = "the transfer ended before the whole file had arrived";
      break;
    default:
      what = "the transfer failed";
      break;
  }
  return VendDownloadError::make(
      VendDownloadError::kTransferFailed,
      "Downloading " + request.url() + " failed: " + what + " (" + transport.description + ")");
}

VendError statusError(const VendURLRequest& request, long status) {
  return VendDownloadError::make(VendDownloadError::kHTTPStatus,
                                 "Downloading " + request.url() +
                                     " failed: the store answered HTTP " + std::to_string(status));
}

bool isRangeRefusal(const VendHTTPTransfer::Result& result) {
  return (result.error && result.error->code == CURLE_RANGE_ERROR) ||
         result.response.statusCode == 416;
}

// A store may announce any size, and its bytes are checked only as they
// arrive: a file that cannot fit is refused before the first one, rather
// than found out when the disk is full.
OptionalError roomFor(const std::string& partialPath, std::uint64_t bytes) {
  const std::string folder = std::filesystem::path(partialPath).parent_path().string();
  struct statvfs info {};
  if (::statvfs(folder.c_str(), &info) != 0) {
    return VendDownloadError::make(
        VendDownloadError::kFileSystem,
        "Cannot inspect the file system of " + folder + ": " + std::strerror(errno));
  }
  const std::uint64_t available = static_cast<std::uint64_t>(info.f_bavail) * info.f_frsize;
  if (bytes <= available && available - bytes >= kSpareBytes) return std::nullopt;
  VendError error = VendDownloadError::make(
      VendDownloadError::kFileSystem,
      "The download " + partialPath + " needs " + std::to_string(bytes) +
          " more bytes; the file system of " + folder + " has " + std::to_string(available) +
          " free and keeps " + std::to_string(kSpareBytes) + " of them spare");
  TILL_LOG(1, "%@: Refusing to download: %@", kSpeaker, error.descriptionText());
  return error;
}

void removeFile(const std::string& path) {
  std::error_code ignored;
  std::filesystem::remove(path, ignored);
}

enum class Attempt { kDone, kStartOver };

struct AttemptResult {
  Attempt next = Attempt::kDone;
  VendAssetFetcher::Result result;
};

AttemptResult failed(VendError error) {
  return {Attempt::kDone, {VendAssetFetcher::Outcome::kFailed, std::move(error)}};
}

AttemptResult fetchOnce(const TillDownloadAsset& asset, const std::string& partialPath,
                        const VendAssetFetcher::Settings& settings,
                        const VendAssetFetcher::Control& control, bool mayStartOver) {
  OptionalError openError;
  std::unique_ptr<VendAssetFileWriter> writer =
      VendAssetFileWriter::open(partialPath, VendAssetFetcher::verifierFor(asset), openError);
  if (!writer) {
    const bool partialIsBad = openError->code == VendDownloadError::kDigestMismatch ||
                              openError->code == VendDownloadError::kSizeMismatch;
    if (partialIsBad && mayStartOver) {
      TILL_LOG(1, "%@: Starting %@ over: %@", kSpeaker, asset.URLRequest().url(),
               openError->descriptionText());
      removeFile(partialPath);
      return {Attempt::kStartOver, {}};
    }
    return failed(std::move(*openError));
  }
  const std::uint64_t offset = writer->existingBytes();
  const auto fileSize = static_cast<std::uint64_t>(asset.fileSize());
  if (offset == fileSize) {
    if (OptionalError error = writer->finish()) return failed(std::move(*error));
    return {Attempt::kDone, {VendAssetFetcher::Outcome::kCompleted, std::nullopt}};
  }
  if (OptionalError error = roomFor(partialPath, fileSize - offset)) {
    return failed(std::move(*error));
  }

  const VendURLRequest request = requestFor(asset, settings);
  std::atomic<long> status{0};
  std::atomic<bool> interrupted{false};
  VendHTTPTransfer::Options options;
  options.resumeFrom = offset;
  options.connectTimeout = settings.connectTimeout;
  options.onResponse = [&](const VendURLResponse& response) { status = response.statusCode; };
  options.onData = [&](std::span<const std::uint8_t> bytes) {
    if (status < 200 || status >= 300) return false;
    if (control.shouldInterrupt && control.shouldInterrupt()) {
      interrupted = true;
      return false;
    }
    return writer->append(bytes);
  };
  options.onProgress = [&](std::uint64_t received, std::uint64_t) {
    if (control.onProgress) control.onProgress(received);
    if (control.shouldInterrupt && control.shouldInterrupt()) {
      interrupted = true;
      return false;
    }
    return true;
  };
  if (offset > 0) {
    TILL_LOG(2, "%@: Resuming %@ from byte %llu", kSpeaker, request.url(), offset);
  }
  const VendHTTPTransfer::Result result = VendHTTPTransfer::perform(request, options);

  if (writer->failed()) return failed(std::move(*writer->close()));
  if (interrupted) {
    if (OptionalError error = writer->close()) return failed(std::move(*error));
    return {Attempt::kDone, {VendAssetFetcher::Outcome::kInterrupted, std::nullopt}};
  }
  if (offset > 0 && mayStartOver && isRangeRefusal(result)) {
    TILL_LOG(1, "%@: The store did not resume %@ at byte %llu; starting over", kSpeaker,
             request.url(), offset);
    writer->close();
    writer.reset();
    removeFile(partialPath);
    return {Attempt::kStartOver, {}};
  }
  if (result.response.statusCode >= 300)
    return failed(statusError(request, result.response.statusCode));
  if (result.error) return failed(transferError(request, *result.error));
  if (OptionalError error = writer->finish()) return failed(std::move(*error));
  return {Attempt::kDone, {VendAssetFetcher::Outcome::kCompleted, std::nullopt}};
}

}  // namespace

VendChunkDigestVerifier VendAssetFetcher::verifierFor(const TillDownloadAsset& asset) {
  return VendChunkDigestVerifier(
      static_cast<std::uint64_t>(std::max<std::int64_t>(asset.fileSize(), 0)),
      static_cast<std::uint64_t>(std::max<std::int64_t>(asset.numberOfBytesToHash(), 0)),
      asset.hashes());
}

VendAssetFetcher::Result VendAssetFetcher::fetch(const TillDownloadAsset& asset,
                                                 const std::string& partialPath,
                                                 const Settings& settings, const Control& control) {
  AttemptResult attempt = fetchOnce(asset, partialPath, settings, control, true);
  if (attempt.next == Attempt::kStartOver) {
    attempt = fetchOnce(asset, partialPath, settings, control, false);
  }
  return attempt.result;
}

OptionalError VendAssetFetcher::verifyFile(const TillDownloadAsset& asset,
                                           const std::string& path) {
  return VendAssetFileWriter::verifyFile(path, verifierFor(asset));
}

}  // namespace larder
