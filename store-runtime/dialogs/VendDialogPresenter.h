#pragma once

#include <functional>
#include <memory>
#include <string_view>

#include "store-runtime/dialogs/VendDialog.h"

namespace larder {

// Where the runtime's UI service sends dialogs. The service process
// installs one that forwards to the dialog agents registered over D-Bus;
// with none installed, or no agent, every dialog is answered as cancelled.
class VendDialogPresenter {
 public:
  using Reply = std::function<void(VendDialogAnswer)>;

  virtual ~VendDialogPresenter() = default;
  // Shows the dialog; `reply` is called exactly once, on any thread.
  virtual void present(const VendDialog& dialog, Reply reply) = 0;
  // Ends a shown dialog as if the user had chosen `exitCode`.
  virtual void dismiss(std::string_view dialogIdentifier, std::int64_t exitCode) = 0;
};

}  // namespace larder
