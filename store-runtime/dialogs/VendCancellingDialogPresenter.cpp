#include "store-runtime/dialogs/VendCancellingDialogPresenter.h"

#include "platform/log/TillLogManager.h"
#include "store-runtime/runtime/VendRuntime.h"

namespace larder {

namespace {
constexpr std::string_view kSpeaker = "VendCancellingDialogPresenter";
}

void VendCancellingDialogPresenter::present(const VendDialog& dialog, Reply reply) {
  TILL_LOG(2, "%@: No one to show dialog %@ (\"%@\") to; it counts as cancelled", kSpeaker,
           dialog.identifier(), dialog.message());
  reply(VendDialogAnswer{VendDialogButton::kCancel, {}, true});
}

void VendCancellingDialogPresenter::dismiss(std::string_view dialogIdentifier,
                                            std::int64_t /*exitCode*/) {
  TILL_LOG(3, "%@: Dialog %@ was never shown; nothing to dismiss", kSpeaker, dialogIdentifier);
}

std::shared_ptr<VendDialogPresenter> VendCancellingDialogPresenter::presenterOf(
    const VendRuntime& runtime) {
  if (auto installed = runtime.dialogPresenter()) return installed;
  static const auto cancelling = std::make_shared<VendCancellingDialogPresenter>();
  return cancelling;
}

}  // namespace larder
