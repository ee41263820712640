#include "store-runtime/download/VendDownloadManager.h"

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstring>
#include <filesystem>

#include "platform/dispatch/DispatchQueue.h"
#include "platform/log/TillLogManager.h"
#include "platform/system/Environment.h"
#include "store-runtime/core/VendStringHelpers.h"
#include "store-runtime/download/VendAssetFetcher.h"
#include "store-runtime/download/VendDownloadError.h"
#include "store-runtime/download/VendPreflightCheck.h"
#include "store-runtime/http/CryptoLibrary.h"

namespace larder {

namespace {

namespace fs = std::filesystem;

constexpr std::string_view kSpeaker = "VendDownloadManager";

std::string hexPrefixOfSha256(std::string_view text, std::size_t bytes) {
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int length = 0;
  const CryptoLibrary& crypto = CryptoLibrary::shared();
  crypto.digest(text.data(), text.size(), digest, &length, crypto.sha256(), nullptr);
  return hexString({digest, std::min<std::size_t>(bytes, length)});
}

// A download's files live under its item identifier. A download that has
// none (a managed manifest's package) is named after its first asset's URL,
// so that two such downloads neither share files nor collide.
std::string storageKey(const TillDownloadFields& fields) {
  if (fields.metadata.itemIdentifier() != 0)
    return std::to_string(fields.metadata.itemIdentifier());
  const std::string url = fields.assets.empty() ? "" : fields.assets.front().URLRequest().url();
  return "url-" + hexPrefixOfSha256(url, 8);
}

std::optional<std::string> unusableReason(const TillDownloadFields& fields) {
  if (fields.assets.empty()) return "it has no assets";
  if ((fields.downloadType & (TillDownload::kInstall | TillDownload::kStageOnly)) == 0) {
    return "its download type " + std::to_string(fields.downloadType) +
           " neither installs nor stages";
  }
  for (std::size_t i = 0; i < fields.assets.size(); ++i) {
    if (std::optional<std::string> reason = fields.assets[i].unusableReason()) {
      return "asset " + std::to_string(i) + ": " + *reason;
    }
  }
  return std::nullopt;
}

std::string describeItem(const TillDownloadFields& fields) {
  return std::to_string(fields.metadata.itemIdentifier()) + " (" +
         (fields.metadata.bundleIdentifier().empty() ? fields.metadata.title()
                                                     : fields.metadata.bundleIdentifier()) +
         ")";
}

std::string packagePath(const std::string& folder, std::size_t index) {
  return folder + "/" + std::to_string(index) + ".pkg";
}

std::string partialPath(const std::string& folder, std::size_t index) {
  return folder + "/" + std::to_string(index) + ".partial";
}

void removeFolder(const std::string& folder) {
  std::error_code code;
  fs::remove_all(folder, code);
  if (code) TILL_LOG(1, "%@: Cannot remove %@: %@", kSpeaker, folder, code.message());
}

// The download's `progress` and a level 3 line at every tenth.
class ProgressReport {
 public:
  ProgressReport(TillDownload& download, std::string item, std::uint64_t totalBytes)
      : download_(download),
        item_(std::move(item)),
        totalBytes_(std::max<std::uint64_t>(totalBytes, 1)) {}

  void reach(std::uint64_t bytes) {
    const double fraction =
        std::min(1.0, static_cast<double>(bytes) / static_cast<double>(totalBytes_));
    download_.setProgress(fraction);
    const int tenth = static_cast<int>(fraction * 10);
    if (tenth > lastTenth_) {
      lastTenth_ = tenth;
      TILL_LOG(3, "%@: Download of %@ at %ld%% (%llu of %llu bytes)", kSpeaker, item_,
               static_cast<long>(tenth) * 10, bytes, totalBytes_);
    }
  }

 private:
  TillDownload& download_;
  std::string item_;
  std::uint64_t totalBytes_;
  int lastTenth_ = -1;
};

// True when the staged package is there and still matches its manifest: a
// package staged for an older version of the item, or damaged on disk,
// does not, and is fetched again.
bool hasVerifiedPackage(const TillDownloadAsset& asset, const std::string& path) {
  std::error_code code;
  if (!fs::exists(path, code)) return false;
  if (OptionalError error = VendAssetFetcher::verifyFile(asset, path)) {
    TILL_LOG(1, "%@: Discarding the staged package %@: %@", kSpeaker, path,
             error->descriptionText());
    fs::remove(path, code);
    return false;
  }
  return true;
}

// A configuration made by hand may leave the folder out; downloads then go
// where the service keeps them, never to a path relative to "/".
VendRuntimeConfiguration withDownloadsDirectory(VendRuntimeConfiguration configuration) {
  if (configuration.downloadsDirectory.empty()) {
    configuration.downloadsDirectory = Environment::cacheHome() + "/com.orvane.larderd/Downloads";
  }
  return configuration;
}

}  // namespace

struct VendDownloadManager::Job {
  enum class State { kQueued, kRunning, kPaused, kFinished };

  std::shared_ptr<TillDownload> download;
  DownloadReply reply;
  std::string key;
  std::uint64_t itemIdentifier = 0;
  State state = State::kQueued;             // guarded by the manager's mutex
  std::atomic<bool> pauseRequested{false};  // read by the transfer's callbacks
};

struct VendDownloadManager::Outcome {
  enum class Kind { kSucceeded, kFailed, kInterrupted };
  Kind kind = Kind::kSucceeded;
  OptionalError error;
  std::optional<std::string> installedPath;

  static Outcome succeeded() { return {}; }
  static Outcome failed(VendError error) { return {Kind::kFailed, std::move(error), {}}; }
  static Outcome interrupted() { return {Kind::kInterrupted, std::nullopt, {}}; }
};

VendDownloadManager::VendDownloadManager(const VendRuntimeConfiguration& configuration)
    : VendDownloadManager(configuration, Limits{}) {}

VendDownloadManager::VendDownloadManager(const VendRuntimeConfiguration& configuration,
                                         Limits limits)
    : configuration_(withDownloadsDirectory(configuration)),
      limits_(limits),
      replyQueue_(
          DispatchQueue::create("VendDownloadManager replies", DispatchQueue::Kind::Concurrent,
                                DispatchQueue::Limits{2, std::chrono::milliseconds(2000)})) {}

VendDownloadManager::~VendDownloadManager() {
  {
    MutexLock lock(mutex_);
    stopping_ = true;
    stopRequested_ = true;
  }
  wake_.notify_all();
  for (std::thread& worker : workers_) worker.join();
  // Whatever is left never ran to its end: queued, paused, or stopped by
  // the shutdown with its partial file kept.
  std::map<std::string, std::shared_ptr<Job>, std::less<>> unanswered;
  {
    MutexLock lock(mutex_);
    unanswered.swap(jobs_);
  }
  for (auto& [key, job] : unanswered) {
    finish(*job, Outcome::failed(VendDownloadError::make(VendDownloadError::kCancelled,
                                                         "The download of " + key +
                                                             " was cancelled because the download "
                                                             "service stopped")));
  }
}

std::string VendDownloadManager::folderForDownload(const TillDownload& download) const {
  return configuration_.downloadsDirectory + "/" + storageKey(download.snapshot());
}

void VendDownloadManager::rejectLater(DownloadReply reply, VendError error) {
  TILL_LOG(1, "%@: %@", kSpeaker, error.descriptionText());
  if (!reply) return;
  replyQueue_->async([reply = std::move(reply), error = std::move(error)] { reply(false, error); });
}

void VendDownloadManager::performDownload(std::shared_ptr<TillDownload> download,
                                          DownloadReply reply) {
  if (!download) {
    rejectLater(std::move(reply), VendDownloadError::make(VendDownloadError::kInvalidDownload,
                                                          "There is no download to perform"));
    return;
  }
  const TillDownloadFields fields = download->snapshot();
  if (std::optional<std::string> reason = unusableReason(fields)) {
    rejectLater(std::move(reply),
                VendDownloadError::make(
                    VendDownloadError::kInvalidDownload,
                    "The download of " + describeItem(fields) + " cannot run: " + *reason));
    return;
  }
  auto job = std::make_shared<Job>();
  job->download = download;
  job->reply = std::move(reply);
  job->key = storageKey(fields);
  job->itemIdentifier = fields.metadata.itemIdentifier();
  {
    MutexLock lock(mutex_);
    if (stopping_ || jobs_.contains(job->key)) {
      const bool duplicate = !stopping_;
      rejectLater(std::move(job->reply),
                  duplicate ? VendDownloadError::make(
                                  VendDownloadError::kAlreadyInProgress,
                                  "Item " + describeItem(fields) + " is downloading already")
                            : VendDownloadError::make(VendDownloadError::kCancelled,
                                                      "The download service is stopping"));
      return;
    }
    download->update([](TillDownloadFields& current) {
      current.status = {};
      current.progress = 0;
    });
    jobs_.emplace(job->key, job);
    queue_.push_back(job);
    ensureWorkers();
  }
  wake_.notify_one();
  TILL_LOG(2, "%@: Queued download of %@, type %lld, %lu asset(s)", kSpeaker, describeItem(fields),
           static_cast<long long>(fields.downloadType), fields.assets.size());
}

void VendDownloadManager::ensureWorkers() {
  // Threads start with the first download, so
  // that a runtime that never downloads holds none.
  while (workers_.size() < std::max<std::size_t>(limits_.concurrentDownloads, 1)) {
    workers_.emplace_back([this] { workerLoop(); });
  }
}

std::vector<std::shared_ptr<TillDownload>> VendDownloadManager::downloadsWithTypeMask(
    std::int64_t mask) const {
  std::vector<std::shared_ptr<TillDownload>> downloads;
  MutexLock lock(mutex_);
  for (const auto& [key, job] : jobs_) {
    if ((job->download->downloadType() & mask) != 0) downloads.push_back(job->download);
  }
  return downloads;
}

void VendDownloadManager::pauseDownloadWithItemIdentifier(std::uint64_t itemIdentifier) {
  MutexLock lock(mutex_);
  for (const auto& [key, job] : jobs_) {
    if (job->itemIdentifier != itemIdentifier) continue;
    if (job->state == Job::State::kQueued) {
      job->state = Job::State::kPaused;
    } else if (job->state == Job::State::kRunning) {
      job->pauseRequested = true;
    } else {
      continue;
    }
    job->download->update([](TillDownloadFields& fields) { fields.status.isPaused = true; });
    TILL_LOG(2, "%@: Pausing download of %llu", kSpeaker, itemIdentifier);
  }
}

void VendDownloadManager::resumeDownloadWithItemIdentifier(std::uint64_t itemIdentifier) {
  bool queued = false;
  {
    MutexLock lock(mutex_);
    for (const auto& [key, job] : jobs_) {
      if (job->itemIdentifier != itemIdentifier) continue;
      if (job->state == Job::State::kPaused) {
        job->state = Job::State::kQueued;
        queue_.push_back(job);
        queued = true;
      } else if (!(job->state == Job::State::kRunning && job->pauseRequested)) {
        continue;
      }
      // A running transfer that was asked to pause either has not stopped
      // yet and goes on, or has stopped and is queued again when it settles.
      job->pauseRequested = false;
      job->download->update([](TillDownloadFields& fields) { fields.status.isPaused = false; });
      TILL_LOG(2, "%@: Resuming download of %llu", kSpeaker, itemIdentifier);
    }
  }
  if (queued) wake_.notify_all();
}

std::shared_ptr<VendDownloadManager::Job> VendDownloadManager::nextJob() {
  MutexLock lock(mutex_);
  for (;;) {
    wake_.wait(lock, [this]() REQUIRES(mutex_) { return stopping_ || !queue_.empty(); });
    if (stopping_) return nullptr;
    std::shared_ptr<Job> job = std::move(queue_.front());
    queue_.pop_front();
    // A job paused while queued, or queued twice by a quick pause and
    // resume, is left where it is.
    if (job->state != Job::State::kQueued) continue;
    job->state = Job::State::kRunning;
    return job;
  }
}

void VendDownloadManager::workerLoop() {
  while (std::shared_ptr<Job> job = nextJob()) settle(job, runJob(*job));
}

void VendDownloadManager::settle(const std::shared_ptr<Job>& job, Outcome outcome) {
  {
    MutexLock lock(mutex_);
    if (outcome.kind == Outcome::Kind::kInterrupted) {
      if (stopping_) return;  // the destructor answers it
      if (job->pauseRequested) {
        job->state = Job::State::kPaused;
        TILL_LOG(2, "%@: Paused download of %llu", kSpeaker, job->itemIdentifier);
      } else {
        job->state = Job::State::kQueued;  // resumed before it had stopped
        queue_.push_back(job);
        wake_.notify_one();
      }
      return;
    }
    job->state = Job::State::kFinished;
    jobs_.erase(job->key);
  }
  finish(*job, outcome);
}

void VendDownloadManager::finish(const Job& job, const Outcome& outcome) {
  const bool success = outcome.kind == Outcome::Kind::kSucceeded;
  job.download->update([&](TillDownloadFields& fields) {
    fields.status.isPaused = false;
    fields.status.isFailed = !success;
    if (success) fields.progress = 1;
    fields.installedPath = outcome.installedPath;
  });
  if (success) {
    TILL_LOG(2, "%@: Download of %@ finished", kSpeaker, job.download->description());
  } else {
    TILL_LOG(1, "%@: Download of %@ failed: %@", kSpeaker, job.download->description(),
             outcome.error ? outcome.error->descriptionText() : std::string("unknown error"));
  }
  if (job.reply) job.reply(success, outcome.error);
}

VendDownloadManager::Outcome VendDownloadManager::runJob(Job& job) {
  const TillDownloadFields fields = job.download->snapshot();
  const std::string folder = configuration_.downloadsDirectory + "/" + job.key;
  std::error_code code;
  fs::create_directories(folder, code);
  if (code) {
    return Outcome::failed(VendDownloadError::make(
        VendDownloadError::kFileSystem,
        "Cannot create the download folder " + folder + ": " + code.message()));
  }
  Outcome outcome = fetchAssets(job, fields, folder);
  if (outcome.kind == Outcome::Kind::kSucceeded &&
      (fields.downloadType & TillDownload::kInstall) != 0) {
    outcome = installAssets(fields, folder);
    if (outcome.kind == Outcome::Kind::kSucceeded) removeFolder(folder);
  } else if (outcome.kind == Outcome::Kind::kSucceeded) {
    TILL_LOG(2, "%@: Staged %@ in %@", kSpeaker, describeItem(fields), folder);
  }
  // Nothing of a failed download stays behind: neither its partial files
  // nor packages staged for it.
  if (outcome.kind == Outcome::Kind::kFailed) removeFolder(folder);
  return outcome;
}

VendDownloadManager::Outcome VendDownloadManager::fetchAssets(Job& job,
                                                              const TillDownloadFields& fields,
                                                              const std::string& folder) {
  std::uint64_t totalBytes = 0;
  for (const TillDownloadAsset& asset : fields.assets)
    totalBytes += static_cast<std::uint64_t>(asset.fileSize());
  ProgressReport progress(*job.download, describeItem(fields), totalBytes);
  const VendAssetFetcher::Settings settings{configuration_.requestTimeout,
                                            configuration_.connectTimeout};
  std::uint64_t bytesBefore = 0;
  for (std::size_t index = 0; index < fields.assets.size(); ++index) {
    const TillDownloadAsset& asset = fields.assets[index];
    const std::string package = packagePath(folder, index);
    if (!hasVerifiedPackage(asset, package)) {
      if (fields.skipAssetDownloadIfNotAlreadyOnDisk) {
        return Outcome::failed(VendDownloadError::make(
            VendDownloadError::kNotOnDisk,
            "Asset " + std::to_string(index) + " of " + describeItem(fields) +
                " is not on disk, and this download may not fetch it "
                "(skipAssetDownloadIfNotAlreadyOnDisk)"));
      }
      const std::string partial = partialPath(folder, index);
      VendAssetFetcher::Control control;
      control.shouldInterrupt = [&] { return job.pauseRequested.load() || stopRequested_.load(); };
      control.onProgress = [&](std::uint64_t received) { progress.reach(bytesBefore + received); };
      VendAssetFetcher::Result result = VendAssetFetcher::fetch(asset, partial, settings, control);
      if (result.outcome == VendAssetFetcher::Outcome::kInterrupted) return Outcome::interrupted();
      if (result.outcome == VendAssetFetcher::Outcome::kFailed)
        return Outcome::failed(std::move(*result.error));
      if (::rename(partial.c_str(), package.c_str()) != 0) {
        return Outcome::failed(VendDownloadError::make(
            VendDownloadError::kFileSystem,
            "Cannot keep the downloaded package " + package + ": " + std::strerror(errno)));
      }
    }
    bytesBefore += static_cast<std::uint64_t>(asset.fileSize());
    progress.reach(bytesBefore);
  }
  return Outcome::succeeded();
}

VendDownloadManager::Outcome VendDownloadManager::installAssets(const TillDownloadFields& fields,
                                                                const std::string& folder) {
  const std::string& bundleIdentifier = fields.metadata.bundleIdentifier();
  // The bundle's applications may not start while it is being replaced.
  if (!bundleIdentifier.empty()) locks_.lock(bundleIdentifier);
  const VendPackageInstaller installer(limits_.installer);
  Outcome outcome = Outcome::succeeded();
  for (std::size_t index = 0; index < fields.assets.size(); ++index) {
    VendPackageInstaller::Result result =
        installer.install(packagePath(folder, index), bundleIdentifier);
    if (result.error) {
      outcome = Outcome::failed(std::move(*result.error));
      break;
    }
    outcome.installedPath = std::move(result.installedPath);
  }
  if (!bundleIdentifier.empty()) locks_.unlock(bundleIdentifier);
  return outcome;
}

void VendDownloadManager::checkPreflight(std::uint64_t itemIdentifier, std::string url,
                                         PlistValue systemVersionInfo, PreflightReply reply) {
  const VendPreflightCheck::Settings settings{configuration_.requestTimeout,
                                              configuration_.connectTimeout};
  replyQueue_->async(
      [=, url = std::move(url), info = std::move(systemVersionInfo), reply = std::move(reply)] {
        VendPreflightCheck::Answer answer =
            VendPreflightCheck::run(itemIdentifier, url, info, settings);
        if (reply) reply(answer.allowed, std::move(answer.object));
      });
}

void VendDownloadManager::lockApplicationsForBundleID(const std::string& bundleIdentifier) {
  locks_.lock(bundleIdentifier);
}

void VendDownloadManager::unlockApplicationsWithBundleIdentifier(
    const std::string& bundleIdentifier) {
  locks_.unlock(bundleIdentifier);
}

}  // namespace larder
