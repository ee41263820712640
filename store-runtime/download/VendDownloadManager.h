#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/error/VendError.h"
#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/core/VendRuntimeConfiguration.h"
#include "store-runtime/download/VendApplicationLocks.h"
#include "store-runtime/download/VendPackageInstaller.h"
#include "store-runtime/records/TillDownload.h"

namespace larder {

class DispatchQueue;

// The process's download layer. Each download runs on a worker thread of
// the manager: its assets are fetched into
// "<downloads folder>/<item>/<n>.partial", checked chunk by chunk while
// they arrive, and renamed to "<n>.pkg" once whole. A stage-only download
// (type 2) ends there; an install (type 1) takes the staged packages, or
// fetches them, installs them and removes them.
//
// Every download's reply is called exactly once, on one of the manager's
// threads, never on the caller's: with success, with the failure, or, when
// the manager is destroyed first, with a cancellation. A paused download
// has not replied yet; it replies when it has been resumed and has ended.
class VendDownloadManager {
 public:
  using DownloadReply = std::function<void(bool success, OptionalError error)>;
  using PreflightReply = std::function<void(bool allowed, PlistValue object)>;

  struct Limits {
    // Downloads that transfer or install at the same time; more wait.
    std::size_t concurrentDownloads = 4;
    VendPackageInstaller::Options installer;
  };

  explicit VendDownloadManager(const VendRuntimeConfiguration& configuration);
  VendDownloadManager(const VendRuntimeConfiguration& configuration, Limits limits);
  // Stops transfers (their partial files stay for a later run) and answers
  // every download that has not replied with a cancellation.
  ~VendDownloadManager();
  VendDownloadManager(const VendDownloadManager&) = delete;
  VendDownloadManager& operator=(const VendDownloadManager&) = delete;

  // Refused at once (still through the reply, on another thread): a
  // download without assets or with an asset that cannot be checked, a
  // download type with neither bit, and a download of an item that is
  // downloading already.
  void performDownload(std::shared_ptr<TillDownload> download, DownloadReply reply);
  // Downloads queued, running or paused whose type shares a bit with `mask`.
  [[nodiscard]] std::vector<std::shared_ptr<TillDownload>> downloadsWithTypeMask(
      std::int64_t mask) const;
  // A transfer stops and keeps its partial file; a queued download waits.
  // An install that has begun is not paused.
  void pauseDownloadWithItemIdentifier(std::uint64_t itemIdentifier);
  // Goes on from the partial file with a range request.
  void resumeDownloadWithItemIdentifier(std::uint64_t itemIdentifier);

  void checkPreflight(std::uint64_t itemIdentifier, std::string url, PlistValue systemVersionInfo,
                      PreflightReply reply);

  void lockApplicationsForBundleID(const std::string& bundleIdentifier);
  void unlockApplicationsWithBundleIdentifier(const std::string& bundleIdentifier);
  [[nodiscard]] const VendApplicationLocks& applicationLocks() const { return locks_; }

  // The folder of a download's partial and staged files.
  [[nodiscard]] std::string folderForDownload(const TillDownload& download) const;

 private:
  struct Job;
  struct Outcome;

  void ensureWorkers() REQUIRES(mutex_);
  void workerLoop();
  std::shared_ptr<Job> nextJob();
  Outcome runJob(Job& job);
  Outcome fetchAssets(Job& job, const TillDownloadFields& fields, const std::string& folder);
  Outcome installAssets(const TillDownloadFields& fields, const std::string& folder);
  void settle(const std::shared_ptr<Job>& job, Outcome outcome);
  void finish(const Job& job, const Outcome& outcome);
  void rejectLater(DownloadReply reply, VendError error);

  const VendRuntimeConfiguration configuration_;
  const Limits limits_;
  VendApplicationLocks locks_;
  std::shared_ptr<DispatchQueue> replyQueue_;

  mutable Mutex mutex_;
  ConditionVariable wake_;
  std::deque<std::shared_ptr<Job>> queue_ GUARDED_BY(mutex_);
  std::map<std::string, std::shared_ptr<Job>, std::less<>> jobs_ GUARDED_BY(mutex_);
  bool stopping_ GUARDED_BY(mutex_) = false;
  std::atomic<bool> stopRequested_{false};
  std::vector<std::thread> workers_ GUARDED_BY(mutex_);
};

}  // namespace larder
