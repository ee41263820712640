#include "store-runtime/host/LedgerFileProgress.h"

#include "platform/log/TillLogManager.h"
#include "store-runtime/host/PlatformStateFile.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "LedgerFileProgress";

PlatformStateFile stateFile() {
  return PlatformStateFile::named("file-progress.plist");
}

PlistDictionary& items(PlistDictionary& state) {
  PlistValue& section = state["items"];
  if (!section.isDictionary()) section = PlistDictionary{};
  return *section.dictionary();
}

}  // namespace

std::shared_ptr<LedgerFileProgress> LedgerFileProgress::make(
    Description description, std::function<void()> cancellationHandler) {
  return std::make_shared<LedgerFileProgress>(Key{}, std::move(description),
                                              std::move(cancellationHandler));
}

LedgerFileProgress::LedgerFileProgress(Key, Description description,
                                       std::function<void()> cancellationHandler)
    : description_(std::move(description)), cancellationHandler_(std::move(cancellationHandler)) {}

LedgerFileProgress::~LedgerFileProgress() {
  unpublish();
}

std::string LedgerFileProgress::stateFilePath() {
  return stateFile().path();
}

void LedgerFileProgress::publish() {
  {
    MutexLock lock(mutex_);
    if (published_) return;
    published_ = true;
  }
  TILL_LOG(3, "%@: Published %@ (%@)", kSpeaker, description_.fileURL, description_.operation);
  if (writeEntry()) cancel();
}

void LedgerFileProgress::unpublish() {
  {
    MutexLock lock(mutex_);
    if (!published_) return;
    published_ = false;
  }
  stateFile().updateDictionary(
      [&](PlistDictionary& state) { items(state).erase(description_.fileURL); });
}

void LedgerFileProgress::setPausable(bool pausable) {
  {
    MutexLock lock(mutex_);
    pausable_ = pausable;
  }
  if (writeEntry()) cancel();
}

void LedgerFileProgress::setCancellable(bool cancellable) {
  {
    MutexLock lock(mutex_);
    cancellable_ = cancellable;
  }
  if (writeEntry()) cancel();
}

void LedgerFileProgress::setCompletedUnitCount(std::int64_t completed) {
  {
    MutexLock lock(mutex_);
    completed_ = completed;
  }
  if (writeEntry()) cancel();
}

std::int64_t LedgerFileProgress::completedUnitCount() const {
  MutexLock lock(mutex_);
  return completed_;
}

bool LedgerFileProgress::isCancelled() const {
  MutexLock lock(mutex_);
  return cancelled_;
}

void LedgerFileProgress::cancel() {
  {
    MutexLock lock(mutex_);
    if (cancelled_ || !cancellable_) return;
    cancelled_ = true;
  }
  TILL_LOG(2, "%@: %@ cancelled", kSpeaker, description_.fileURL);
  if (cancellationHandler_) cancellationHandler_();
}

bool LedgerFileProgress::writeEntry() {
  PlistDictionary entry;
  {
    MutexLock lock(mutex_);
    if (!published_) return false;
    entry = {{"kind", description_.kind},
             {"operation", description_.operation},
             {"totalUnitCount", description_.totalUnitCount},
             {"completedUnitCount", completed_},
             {"cancellable", cancellable_},
             {"pausable", pausable_},
             {"date", PlistDate::now()}};
  }
  bool cancelRequested = false;
  stateFile().updateDictionary([&](PlistDictionary& state) {
    PlistValue& slot = items(state)[description_.fileURL];
    cancelRequested = slot["cancelRequested"].boolValue();
    slot = std::move(entry);
  });
  return cancelRequested;
}

}  // namespace larder
