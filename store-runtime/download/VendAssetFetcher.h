#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <string>

#include "platform/error/VendError.h"
#include "store-runtime/download/VendChunkDigestVerifier.h"
#include "store-runtime/records/TillDownloadAsset.h"

namespace larder {

// Brings one asset into its partial file and checks it on the way: a fresh
// transfer, or the rest of one that was paused (an HTTP range request from
// the partial file's size).
class VendAssetFetcher {
 public:
  struct Settings {
    // Seconds without progress after which a transfer fails; replaces the
    // request's own limit when that is the default one.
    double requestTimeout = 60;
    std::chrono::milliseconds connectTimeout{10000};
  };
  struct Control {
    // Asked while the transfer runs; true stops it and keeps the partial
    // file for a later resume.
    std::function<bool()> shouldInterrupt;
    // Bytes of the asset received so far, the partial file's included.
    std::function<void(std::uint64_t received)> onProgress;
  };
  enum class Outcome { kCompleted, kInterrupted, kFailed };
  struct Result {
    Outcome outcome = Outcome::kFailed;
    OptionalError error;  // set for kFailed
  };

  // On kCompleted the partial file holds the whole asset, checked against
  // every digest. On kFailed the caller removes the partial file.
  static Result fetch(const TillDownloadAsset& asset, const std::string& partialPath,
                      const Settings& settings, const Control& control);

  // Reads a finished file through a verifier of the asset's manifest.
  static OptionalError verifyFile(const TillDownloadAsset& asset, const std::string& path);

  static VendChunkDigestVerifier verifierFor(const TillDownloadAsset& asset);
};

}  // namespace larder
