#pragma once

#include <memory>
#include <span>
#include <string_view>

#include <sdbus-c++/IObject.h>
#include <sdbus-c++/Message.h>

#include "AssetService/BusMethodExport.h"
#include "platform/system/Mutex.h"
#include "store-runtime/records/TillDownload.h"

namespace larder {

// The store runtime's accounts, purchases and downloads for tools and scripts
// on the bus (`larderctl signin`, `purchase`, `downloads`). Every method answers from
// the runtime's service queue, so the bus thread never waits for the store.
class StoreRuntimeInterface : public std::enable_shared_from_this<StoreRuntimeInterface> {
 public:
  // Adds the methods and the signal to the service object before its
  // registration ends.
  void exportOn(sdbus::IObject& object);
  // From here on no signal is sent: the object is about to go.
  void withdraw();

 private:
  void startDownloads(const std::vector<std::shared_ptr<TillDownload>>& downloads);
  void announceDownloadEnded(const TillDownload& download, bool success,
                             const OptionalError& error);

  void signIn(sdbus::MethodCall call);
  void signOut(sdbus::MethodCall call);
  void primaryAccount(sdbus::MethodCall call);
  void purchase(sdbus::MethodCall call);
  void downloads(sdbus::MethodCall call);

  Mutex objectMutex_;
  sdbus::IObject* object_ GUARDED_BY(objectMutex_) = nullptr;
};

}  // namespace larder
