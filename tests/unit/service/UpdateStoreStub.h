// A store on loopback that serves only what an update check needs: a URL
// bag and the update route. Tests choose the bag's settings and the answer,
// can hold the answer back, and see every request the route received.
#pragma once

#include <httplib.h>

#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/runtime/VendRuntime.h"

namespace larder::testing {

class UpdateStoreStub {
 public:
  struct Request {
    std::string body;
    std::string contentEncoding;
    std::string contentType;
  };
  struct Answer {
    int status = 200;
    std::string body;
  };

  UpdateStoreStub() {
    server_.Get("/bag.plist", [this](const httplib::Request&, httplib::Response& response) {
      PlistDictionary bag;
      {
        std::lock_guard lock(mutex_);
        bag = bag_;
      }
      bag.insert_or_assign("available-software-updates-extended", baseURL() + "/updates");
      response.set_content(PropertyListSerialization::writeXml(bag), "application/x-plist");
    });
    server_.Post("/updates", [this](const httplib::Request& request, httplib::Response& response) {
      Answer answer;
      {
        std::unique_lock lock(mutex_);
        requests_.push_back({request.body, request.get_header_value("Content-Encoding"),
                             request.get_header_value("Content-Type")});
        released_.wait(lock, [this] { return !holding_; });
        answer = answer_;
      }
      response.status = answer.status;
      response.set_content(answer.body, "application/x-plist");
    });
    port_ = server_.bind_to_any_port("127.0.0.1");
    thread_ = std::thread([this] { server_.listen_after_bind(); });
    while (!server_.is_running()) std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }

  ~UpdateStoreStub() {
    release();
    server_.stop();
    thread_.join();
  }
  UpdateStoreStub(const UpdateStoreStub&) = delete;
  UpdateStoreStub& operator=(const UpdateStoreStub&) = delete;

  [[nodiscard]] std::string baseURL() const { return "http://127.0.0.1:" + std::to_string(port_); }

  // Entries of the bag besides the update URL.
  void setBag(PlistDictionary bag) {
    std::lock_guard lock(mutex_);
    bag_ = std::move(bag);
  }
  void answer(const PlistValue& plist, int status = 200) {
    answerRaw(PropertyListSerialization::writeXml(plist), status);
  }
  void answerRaw(std::string body, int status = 200) {
    std::lock_guard lock(mutex_);
    answer_ = {status, std::move(body)};
  }

  // Update requests wait until `release`.
  void hold() {
    std::lock_guard lock(mutex_);
    holding_ = true;
  }
  void release() {
    {
      std::lock_guard lock(mutex_);
      holding_ = false;
    }
    released_.notify_all();
  }

  [[nodiscard]] std::vector<Request> requests() const {
    std::lock_guard lock(mutex_);
    return requests_;
  }
  [[nodiscard]] std::size_t requestCount() const { return requests().size(); }

  // A runtime whose bag is this store's, with files below `folder`.
  [[nodiscard]] std::shared_ptr<VendRuntime> runtime(const std::string& folder) const {
    VendRuntimeConfiguration configuration;
    configuration.bagURL = baseURL() + "/bag.plist";
    configuration.stateDirectory = folder + "/state";
    configuration.downloadsDirectory = folder + "/downloads";
    configuration.requestTimeout = 5;
    return std::make_shared<VendRuntime>(configuration);
  }

 private:
  httplib::Server server_;
  int port_ = 0;
  std::thread thread_;
  mutable std::mutex mutex_;
  std::condition_variable released_;
  bool holding_ = false;
  PlistDictionary bag_;
  Answer answer_{200, PropertyListSerialization::writeXml(PlistDictionary{})};
  std::vector<Request> requests_;
};

}  // namespace larder::testing
