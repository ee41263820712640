#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string>

#include "client/ServiceClient.h"
#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"

namespace larder {

// Follows the downloads of a purchase to their ends as the service reports
// them: success is the service's word that the purchased version is
// installed, never a guess from what happens to be on disk. Made before the
// purchase is sent, so that no ending can slip by before it listens.
class DownloadFollower {
 public:
  DownloadFollower(ServiceClient& client, bool json);

  // Waits for every download of `started` to end, with a progress bar on a
  // terminal; a line per download (or one JSON document). The exit status:
  // success only when every download was installed.
  int follow(const PlistArray& started);

 private:
  struct Ending {
    PlistValue download;
    bool success = false;
    PlistValue error;
  };

  // What the bus thread hands over; shared with the callbacks, which the
  // client keeps as long as it lives.
  struct Inbox {
    Mutex mutex;
    ConditionVariable changed;
    std::map<std::uint64_t, Ending> endings GUARDED_BY(mutex);
    bool serviceGone GUARDED_BY(mutex) = false;
  };

  void showProgress(const std::map<std::uint64_t, std::string>& pending,
                    class ProgressBar& bar) const;
  bool report(const Ending& ending, const std::string& title) const;

  ServiceClient& client_;
  bool json_;
  std::shared_ptr<Inbox> inbox_ = std::make_shared<Inbox>();
};

}  // namespace larder
