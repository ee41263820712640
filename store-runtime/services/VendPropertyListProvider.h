#pragma once

#include <memory>
#include <vector>

#include "store-runtime/services/VendDataProvider.h"

namespace larder {

class TillDownload;

// A data provider whose output is the parsed property list. A store answer
// may carry orders besides its data, and four switches say which of them
// are obeyed while parsing:
//  - protocol: a "failureType" in the answer makes the parse fail with
//    the store's customer message;
//  - dialogs: a "dialog" dictionary in the answer is shown to the user;
//  - downloads: the "downloads" array is taken up (`downloads()`);
//  - trigger: the downloads taken up are started.
class VendPropertyListProvider : public VendDataProvider {
 public:
  using VendDataProvider::VendDataProvider;

  static std::shared_ptr<VendPropertyListProvider> providerWithStoreClient(
      VendStoreClient storeClient) {
    return std::make_shared<VendPropertyListProvider>(std::move(storeClient));
  }

  bool parseData(const PlistData& data, OptionalError* error) override;
  void configureFromProvider(const VendDataProvider& other) override;
  void migrateOutputFromSubProvider(const VendDataProvider& subProvider) override;

  void setShouldProcessProtocol(bool value) { shouldProcessProtocol_ = value; }
  void setShouldProcessDialogs(bool value) { shouldProcessDialogs_ = value; }
  void setShouldProcessDownloads(bool value) { shouldProcessDownloads_ = value; }
  void setShouldTriggerDownloads(bool value) { shouldTriggerDownloads_ = value; }
  [[nodiscard]] bool shouldProcessProtocol() const { return shouldProcessProtocol_; }
  [[nodiscard]] bool shouldProcessDialogs() const { return shouldProcessDialogs_; }
  [[nodiscard]] bool shouldProcessDownloads() const { return shouldProcessDownloads_; }
  [[nodiscard]] bool shouldTriggerDownloads() const { return shouldTriggerDownloads_; }

  // The downloads the answer carried, when they were taken up.
  [[nodiscard]] const std::vector<std::shared_ptr<TillDownload>>& downloads() const {
    return downloads_;
  }

 private:
  bool processProtocol(const PlistValue& answer, OptionalError* error) const;
  void processDialog(const PlistValue& answer) const;
  void processDownloads(const PlistValue& answer);

  bool shouldProcessProtocol_ = true;
  bool shouldProcessDialogs_ = true;
  bool shouldProcessDownloads_ = true;
  bool shouldTriggerDownloads_ = true;
  std::vector<std::shared_ptr<TillDownload>> downloads_;
};

}  // namespace larder
