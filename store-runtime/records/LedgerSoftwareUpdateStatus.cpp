#include "store-runtime/records/LedgerSoftwareUpdateStatus.h"

#include <algorithm>
#include <cmath>

#include "platform/plist/KeyedArchive.h"
#include "store-runtime/records/RecordFieldReader.h"
#include "store-runtime/records/RecordFieldWriter.h"

namespace larder {

namespace {

double clampedPercent(double progress) {
  if (std::isnan(progress)) return 0;
  return std::clamp(progress, 0.0, 100.0);
}

std::optional<std::int64_t> stateFromStatusInfo(const PlistDictionary& statusInfo) {
  RecordFieldReader reader(statusInfo);
  if (std::optional<std::int64_t> state =
          reader.integer(LedgerSoftwareUpdateStatus::kStatusInfoStateKey)) {
    return state;
  }
  const std::optional<std::string> phase =
      reader.string(LedgerSoftwareUpdateStatus::kStatusInfoCurrentStateKey);
  if (phase == "downloading") return LedgerSoftwareUpdateStatus::kStateDownloading;
  if (phase == "installing") return LedgerSoftwareUpdateStatus::kStateInstalling;
  return std::nullopt;
}

}  // namespace

LedgerSoftwareUpdateStatus LedgerSoftwareUpdateStatus::initWithProgress(
    double progress, std::optional<PlistDictionary> statusInfo, bool canCancel) {
  LedgerSoftwareUpdateStatus status;
  status.percentComplete_ = clampedPercent(progress);
  status.canCancel_ = canCancel;
  std::optional<std::int64_t> state = statusInfo ? stateFromStatusInfo(*statusInfo) : std::nullopt;
  status.state_ =
      state.value_or(status.percentComplete_ >= 100.0 ? kStateFinished : kStateInstalling);
  status.statusInfo_ = std::move(statusInfo);
  return status;
}

LedgerSoftwareUpdateStatus LedgerSoftwareUpdateStatus::initWithError(VendError error) {
  LedgerSoftwareUpdateStatus status;
  status.state_ = kStateFailed;
  status.error_ = std::move(error);
  return status;
}

PlistDictionary LedgerSoftwareUpdateStatus::encodeWithCoder() const {
  PlistDictionary encoded = KeyedArchive::record(kClassName);
  encoded.merge(toDictionary());
  return encoded;
}

std::optional<LedgerSoftwareUpdateStatus> LedgerSoftwareUpdateStatus::initWithCoder(
    const PlistValue& encoded) {
  if (KeyedArchive::classNameOf(encoded) != kClassName) return std::nullopt;
  const PlistDictionary* fields = encoded.dictionary();
  return fields ? fromDictionary(*fields) : std::nullopt;
}

PlistDictionary LedgerSoftwareUpdateStatus::toDictionary() const {
  PlistDictionary dictionary;
  RecordFieldWriter writer(dictionary);
  writer.put("percentComplete", percentComplete_);
  writer.put("canCancel", canCancel_);
  writer.put("state", state_);
  writer.put("statusInfo", statusInfo_);
  if (error_) writer.put("error", error_->toDictionary());
  return dictionary;
}

std::optional<LedgerSoftwareUpdateStatus> LedgerSoftwareUpdateStatus::fromDictionary(
    const PlistDictionary& dictionary) {
  RecordFieldReader reader(dictionary);
  LedgerSoftwareUpdateStatus status;
  status.percentComplete_ = clampedPercent(reader.real("percentComplete").value_or(0));
  status.canCancel_ = reader.boolean("canCancel").value_or(false);
  status.state_ = reader.integer("state").value_or(kStateInstalling);
  status.statusInfo_ = reader.dictionary("statusInfo");
  if (std::optional<PlistDictionary> error = reader.dictionary("error")) {
    status.error_ = VendError::fromDictionary(*error);
  }
  if (!reader.ok()) return std::nullopt;
  return status;
}

std::string LedgerSoftwareUpdateStatus::description() const {
  std::string text =
      "<LedgerSoftwareUpdateStatus: percentComplete=" + std::to_string(percentComplete_) +
      " state=" + std::to_string(state_) + " canCancel=" + (canCancel_ ? "1" : "0");
  if (error_) text += " error=" + error_->descriptionText();
  return text + ">";
}

}  // namespace larder
