#pragma once

#include <memory>

#include "store-runtime/dialogs/VendDialogPresenter.h"

namespace larder {

class VendRuntime;

// The presenter of a runtime that has nobody to show dialogs to: every
// dialog is answered at once as cancelled, so that nothing waits for a user
// who cannot be asked.
class VendCancellingDialogPresenter final : public VendDialogPresenter {
 public:
  void present(const VendDialog& dialog, Reply reply) override;
  // Nothing is ever shown, so there is nothing to take down.
  void dismiss(std::string_view dialogIdentifier, std::int64_t exitCode) override;

  // The presenter the runtime has installed, or else one of these.
  static std::shared_ptr<VendDialogPresenter> presenterOf(const VendRuntime& runtime);
};

}  // namespace larder
