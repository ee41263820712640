#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/error/VendError.h"
#include "platform/value/PlistValue.h"

namespace larder {

// Progress of a run over OS updates, as OS update progress observers
// receive it. A plain value, made anew at every step.
class LedgerSoftwareUpdateStatus {
 public:
  static constexpr std::string_view kClassName = "LedgerSoftwareUpdateStatus";

  // Phases of an install. Finished and failed are the two that end it.
  enum State : std::int64_t {
    kStateDownloading = 1,
    kStateInstalling = 2,
    kStateFinished = 4,
    kStateFailed = 6,
  };
  // Keys of the framework's status information that give the phase: a
  // number that is a state, or a word ("downloading", "installing").
  static constexpr std::string_view kStatusInfoStateKey = "state";
  static constexpr std::string_view kStatusInfoCurrentStateKey = "currentState";

  // Progress in percent, clamped to 0...100 (anything not a number counts
  // as 0). The phase comes from the status information when it says, else
  // it is finished at 100 percent and installing before that.
  static LedgerSoftwareUpdateStatus initWithProgress(double progress,
                                                     std::optional<PlistDictionary> statusInfo,
                                                     bool canCancel);
  // A failed run: state failed, nothing to cancel.
  static LedgerSoftwareUpdateStatus initWithError(VendError error);

  [[nodiscard]] double percentComplete() const { return percentComplete_; }
  [[nodiscard]] bool canCancel() const { return canCancel_; }
  [[nodiscard]] std::int64_t state() const { return state_; }
  [[nodiscard]] const std::optional<PlistDictionary>& statusInfo() const { return statusInfo_; }
  [[nodiscard]] const std::optional<VendError>& error() const { return error_; }
  [[nodiscard]] bool hasEnded() const { return state_ == kStateFinished || state_ == kStateFailed; }

  // Keyed-archive form: the wire keys plus "$class".
  [[nodiscard]] PlistDictionary encodeWithCoder() const;
  static std::optional<LedgerSoftwareUpdateStatus> initWithCoder(const PlistValue& encoded);

  // Wire form: "percentComplete", "canCancel", "state", and "statusInfo"
  // and "error" when present.
  [[nodiscard]] PlistDictionary toDictionary() const;
  static std::optional<LedgerSoftwareUpdateStatus> fromDictionary(
      const PlistDictionary& dictionary);

  [[nodiscard]] std::string description() const;

  friend bool operator==(const LedgerSoftwareUpdateStatus&,
                         const LedgerSoftwareUpdateStatus&) = default;

 private:
  LedgerSoftwareUpdateStatus() = default;

  double percentComplete_ = 0;
  bool canCancel_ = false;
  std::int64_t state_ = kStateInstalling;
  std::optional<PlistDictionary> statusInfo_;
  std::optional<VendError> error_;
};

}  // namespace larder
