#include "store-runtime/host/LedgerPowerSource.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <exception>
#include <filesystem>
#include <optional>
#include <string_view>
#include <thread>
#include <utility>

#include "platform/background/BackgroundActivityPowerSource.h"
#include "platform/log/TillLogManager.h"
#include "platform/system/Environment.h"
#include "platform/system/FileIO.h"
#include "platform/system/Mutex.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "LedgerPowerSource";
// A sysfs attribute is one short line; the kernel reports every one as 4096 bytes long.
constexpr std::size_t kMaxAttributeBytes = 4096;
constexpr double kSecondsPerHour = 3600.0;

std::string supplyFolder() {
  return Environment::rootedPath("/sys/class/power_supply");
}

std::string firstWordOfAttribute(const std::string& path) {
  std::optional<PlistData> bytes = FileIO::read(path, kMaxAttributeBytes).optional();
  if (!bytes) return {};
  std::string_view text(reinterpret_cast<const char*>(bytes->data()), bytes->size());
  const std::size_t start = text.find_first_not_of(" \t\r\n");
  if (start == std::string_view::npos) return {};
  text.remove_prefix(start);
  return std::string(text.substr(0, text.find_first_of(" \t\r\n")));
}

// A reading the estimate can use: a finite, non-zero number and nothing else. Some drivers give
// the draw of a discharging battery as a negative current, so only its size counts.
std::optional<double> magnitudeOfAttribute(const std::string& path) {
  const std::string word = firstWordOfAttribute(path);
  double value = 0;
  const auto [end, code] = std::from_chars(word.data(), word.data() + word.size(), value);
  if (word.empty() || code != std::errc{} || end != word.data() + word.size()) return std::nullopt;
  if (!std::isfinite(value) || value == 0) return std::nullopt;
  return std::fabs(value);
}

// Wireless mice and keyboards show their batteries here too, with the scope "Device"; the
// machine's own batteries have the scope "System" or none at all.
bool isSystemBattery(const std::string& supply) {
  return firstWordOfAttribute(supply + "/type") == "Battery" &&
         firstWordOfAttribute(supply + "/scope") != "Device";
}

// Seconds left in one battery: what it holds over what it draws, in energy (µWh / µW) when the
// driver gives both, else in charge (µAh / µA).
std::optional<double> secondsLeftInBattery(const std::string& supply) {
  for (auto [stored, draw] :
       {std::pair{"/energy_now", "/power_now"}, std::pair{"/charge_now", "/current_now"}}) {
    std::optional<double> amount = magnitudeOfAttribute(supply + stored);
    std::optional<double> rate = magnitudeOfAttribute(supply + draw);
    if (amount && rate) return *amount / *rate * kSecondsPerHour;
  }
  return std::nullopt;
}

// One battery's warning: the driver's own word first, since it knows the
// cell's chemistry; the percentage only when it gives none.
std::optional<std::int64_t> warningLevelOfBattery(const std::string& supply) {
  const std::string level = firstWordOfAttribute(supply + "/capacity_level");
  if (level == "Critical") return LedgerPowerSource::kFinalWarning;
  if (level == "Low") return LedgerPowerSource::kEarlyWarning;
  if (!level.empty() && level != "Unknown") return LedgerPowerSource::kNoWarning;
  const std::string word = firstWordOfAttribute(supply + "/capacity");
  std::int64_t percent = 0;
  const auto [end, code] = std::from_chars(word.data(), word.data() + word.size(), percent);
  if (word.empty() || code != std::errc{} || end != word.data() + word.size()) return std::nullopt;
  if (percent <= LedgerPowerSource::kFinalWarningPercent) return LedgerPowerSource::kFinalWarning;
  if (percent <= LedgerPowerSource::kEarlyWarningPercent) return LedgerPowerSource::kEarlyWarning;
  return LedgerPowerSource::kNoWarning;
}

// What the observation shares with its timer's work, which may outlive the observation by
// one fire that is already running.
class PowerPoll {
 public:
  PowerPoll(std::function<void()> callback, std::string folder)
      : callback_(std::move(callback)),
        folder_(std::move(folder)),
        lastOnMains_(BackgroundActivityPowerSource::mainsPowerInSupplyFolder(folder_)) {}

  // Runs on the loop only, one fire at a time, so lastOnMains_ needs no lock.
  void poll() {
    const bool onMains = BackgroundActivityPowerSource::mainsPowerInSupplyFolder(folder_);
    if (onMains == lastOnMains_) return;
    lastOnMains_ = onMains;
    TILL_LOG(2, "%@: The machine now runs on %@", kSpeaker, onMains ? "mains power" : "battery");
    if (!beginCallback()) return;
    struct EndCallback {
      PowerPoll& poll;
      ~EndCallback() { poll.endCallback(); }
    } end{*this};
    callback_();
  }

  // Waits for a callback running on another thread, so that nothing the callback uses goes away
  // under it; from inside the callback itself there is nothing to wait for.
  void cancel() {
    MutexLock lock(mutex_);
    cancelled_ = true;
    const auto me = std::this_thread::get_id();
    idle_.wait(lock, [&]() REQUIRES(mutex_) { return !firingThread_ || *firingThread_ == me; });
  }

 private:
  bool beginCallback() {
    MutexLock lock(mutex_);
    if (cancelled_) return false;
    firingThread_ = std::this_thread::get_id();
    return true;
  }
  void endCallback() {
    MutexLock lock(mutex_);
    firingThread_.reset();
    idle_.notify_all();
  }

  const std::function<void()> callback_;
  const std::string folder_;
  bool lastOnMains_;
  Mutex mutex_;
  ConditionVariable idle_;
  bool cancelled_ GUARDED_BY(mutex_) = false;
  std::optional<std::thread::id> firingThread_ GUARDED_BY(mutex_);
};

class PollingObservation final : public LedgerPowerSource::Observation {
 public:
  PollingObservation(RunLoop& loop, std::shared_ptr<PowerPoll> poll, RunLoop::TimerId timer)
      : loop_(loop), poll_(std::move(poll)), timer_(timer) {}
  ~PollingObservation() override {
    loop_.cancelTimer(timer_);
    poll_->cancel();
  }
  PollingObservation(const PollingObservation&) = delete;
  PollingObservation& operator=(const PollingObservation&) = delete;

 private:
  RunLoop& loop_;
  std::shared_ptr<PowerPoll> poll_;
  RunLoop::TimerId timer_;
};

// Calls `visit` with the folder of each battery of the machine in `folder`.
template <typename Visit>
void forEachSystemBattery(const std::string& folder, Visit&& visit) {
  std::error_code code;
  std::filesystem::directory_iterator iterator(folder, code);
  for (std::filesystem::directory_iterator end; !code && iterator != end;
       iterator.increment(code)) {
    const std::string supply = iterator->path().string();
    if (isSystemBattery(supply)) visit(supply);
  }
}

}  // namespace

double LedgerPowerSource::remainingTimeEstimate() {
  return remainingTimeEstimateInSupplyFolder(supplyFolder());
}

double LedgerPowerSource::remainingTimeEstimateInSupplyFolder(const std::string& folder) {
  if (BackgroundActivityPowerSource::mainsPowerInSupplyFolder(folder)) {
    return kUnlimitedRemainingTime;
  }
  double total = 0;
  bool anyEstimate = false;
  forEachSystemBattery(folder, [&](const std::string& supply) {
    if (std::optional<double> seconds = secondsLeftInBattery(supply)) {
      total += *seconds;
      anyEstimate = true;
    }
  });
  TILL_LOG(3, "%@: Remaining time %@ s", kSpeaker, anyEstimate ? total : kUnknownRemainingTime);
  return anyEstimate ? total : kUnknownRemainingTime;
}

std::int64_t LedgerPowerSource::batteryWarningLevel() {
  return batteryWarningLevelInSupplyFolder(supplyFolder());
}

std::int64_t LedgerPowerSource::batteryWarningLevelInSupplyFolder(const std::string& folder) {
  if (BackgroundActivityPowerSource::mainsPowerInSupplyFolder(folder)) return kNoWarning;
  std::optional<std::int64_t> least;
  forEachSystemBattery(folder, [&](const std::string& supply) {
    if (std::optional<std::int64_t> level = warningLevelOfBattery(supply)) {
      least = least ? std::min(*least, *level) : *level;
    }
  });
  TILL_LOG(3, "%@: Battery warning level %@", kSpeaker, least.value_or(kNoWarning));
  return least.value_or(kNoWarning);
}

std::unique_ptr<LedgerPowerSource::Observation> LedgerPowerSource::observeLimitedPowerChanges(
    std::function<void()> callback) {
  return observeLimitedPowerChanges(std::move(callback), RunLoop::main(), kPollInterval);
}

std::unique_ptr<LedgerPowerSource::Observation> LedgerPowerSource::observeLimitedPowerChanges(
    std::function<void()> callback, RunLoop& loop, RunLoop::Clock::duration interval) {
  if (!callback) {
    TILL_LOG(1, "%@: No power observation without a callback", kSpeaker);
    return nullptr;
  }
  try {
    auto poll = std::make_shared<PowerPoll>(std::move(callback), supplyFolder());
    // A fifth of the interval lets the loop fold this wake-up into others.
    const RunLoop::TimerId timer = loop.addTimer(
        interval, true, [poll] { poll->poll(); }, interval / 5);
    return std::make_unique<PollingObservation>(loop, std::move(poll), timer);
  } catch (const std::exception& error) {
    TILL_LOG(1, "%@: Could not start the power observation: %@", kSpeaker, error.what());
    return nullptr;
  }
}

}  // namespace larder
