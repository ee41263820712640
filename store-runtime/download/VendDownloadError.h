#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/error/VendError.h"

namespace larder {

// The failures of the download layer. Every one carries a description that
// says what went wrong with which file or request, because it ends up in the
// log and in the audit of an update without further context.
struct VendDownloadError {
  static constexpr std::string_view kDomain = "VendDownloadErrorDomain";

  enum Code : std::int64_t {
    kInvalidDownload = 1,    // the record cannot be downloaded as it is
    kAlreadyInProgress = 2,  // the same item is downloading already
    kHTTPStatus = 3,         // the store answered with a failure status
    kTransferFailed = 4,     // connection refused, lost, stalled, truncated
    kDigestMismatch = 5,     // a chunk's digest differs from the manifest
    kSizeMismatch = 6,       // the file is longer or shorter than announced
    kFileSystem = 7,         // the downloads folder could not be written
    kNotOnDisk = 8,          // a run that may not download found nothing staged
    kUnsafePackage = 9,      // the package would write outside its bundle
    kInstallFailed = 10,     // extracting or moving into place failed
    kPreflightFailed = 11,   // the store does not allow the item here
    kCancelled = VendError::kCancelledCode,
  };

  static VendError make(Code code, std::string description) {
    return VendError::withDomain(std::string(kDomain), code, std::move(description));
  }
};

}  // namespace larder
