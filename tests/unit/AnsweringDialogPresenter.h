#pragma once

#include <cstdint>
#include <mutex>
#include <vector>

#include "platform/value/PlistValue.h"
#include "store-runtime/dialogs/VendDialogPresenter.h"

namespace larder::testing {

// Answers every dialog at once with one exit code and keeps what it was
// shown, as the dialog agent would get it.
class AnsweringDialogPresenter final : public VendDialogPresenter {
 public:
  explicit AnsweringDialogPresenter(std::int64_t exitCode = VendDialogButton::kOK)
      : exitCode_(exitCode) {}

  void present(const VendDialog& dialog, Reply reply) override {
    {
      std::lock_guard lock(mutex_);
      shown_.push_back(dialog.toDictionary());
    }
    reply(VendDialogAnswer{exitCode_, {}});
  }
  void dismiss(std::string_view, std::int64_t) override {}

  std::vector<PlistDictionary> shown() {
    std::lock_guard lock(mutex_);
    return shown_;
  }

 private:
  const std::int64_t exitCode_;
  std::mutex mutex_;
  std::vector<PlistDictionary> shown_;
};

}  // namespace larder::testing
