#include "store-runtime/dialogs/VendCancellingDialogPresenter.h"

#include "platform/log/TillLogManager.h"

namespace larder {

namespace {
constexpr std::string_view kSpeaker = "VendCancellingDialogPresenter";
}

void VendCancellingDialogPresenter::present(const VendDialog& dialog, Reply reply) {
  TILL_LOG(2, "%@: No one to show dialog %@ (\"%@\") to; it counts as cancelled", kSpeaker,
           dialog.identifier(), dialog.message());
  reply(VendDialogAnswer{VendDialogButton::kCancel, {}});
}

void VendCancellingDialogPresenter::dismiss(std::string_view dialogIdentifier,
                                            std::int64_t /*exitCode*/) {
  TILL_LOG(3, "%@: Dialog %@ was never shown; nothing to dismiss", kSpeaker, dialogIdentifier);
}

}  // namespace larder
