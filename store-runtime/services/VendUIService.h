#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "store-runtime/core/VendStoreClient.h"
#include "store-runtime/dialogs/VendDialog.h"

namespace larder {

class VendDialogPresenter;
class VendOperationDelegate;
class VendRuntime;

// The user interface service of one store client: shows dialogs to the
// logged-in user through the runtime's dialog presenter. Every reply is
// called exactly once, on any thread: a second answer of a presenter is
// dropped, and a presenter that lets a dialog go without answering it
// answers "cancelled".
class VendUIService {
 public:
  // A null runtime means the shared one.
  VendUIService(VendStoreClient storeClient, std::shared_ptr<VendRuntime> runtime);

  [[nodiscard]] const VendStoreClient& storeClient() const { return storeClient_; }

  // Shows the dialog; the reply has the exit code, 1 for the OK button and 0
  // when nobody could be asked. The delegate is kept until the answer; a
  // dialog has no progress or failure to tell it.
  void displayDialog(const VendDialog& dialog, std::shared_ptr<VendOperationDelegate> delegate,
                     std::function<void(std::int64_t exitCode)> reply);
  // The same with the agent's whole answer, for dialogs that ask for more
  // than a button (a sign-in dialog's "accountName" and "password").
  void presentDialog(const VendDialog& dialog, std::function<void(VendDialogAnswer)> reply);
  // Ends a shown dialog from this side, as if the user had chosen `exitCode`.
  void dismissDialog(const VendDialog& dialog, std::int64_t exitCode);

  // Show the long text of an OS update; the reply says whether the user
  // agreed (chose OK).
  void displayFirmwareWarningWithTitle(const std::string& title, const std::string& content,
                                       std::function<void(bool agreed)> reply);
  void displayLicenseAgreementWithTitle(const std::string& title, const std::string& content,
                                        std::function<void(bool agreed)> reply);

 private:
  void displayAgreement(VendDialog dialog, const std::string& content,
                        std::function<void(bool agreed)> reply);
  [[nodiscard]] std::shared_ptr<VendDialogPresenter> presenter() const;

  VendStoreClient storeClient_;
  std::shared_ptr<VendRuntime> runtime_;
};

}  // namespace larder
