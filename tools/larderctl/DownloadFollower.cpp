#include "tools/larderctl/DownloadFollower.h"

#include <chrono>
#include <iostream>

#include "platform/plist/JsonConversion.h"
#include "tools/larderctl/ExitStatus.h"
#include "tools/larderctl/ProgressBar.h"

namespace larder {
namespace {

constexpr std::chrono::milliseconds kProgressInterval{200};
constexpr std::int64_t kAllDownloadTypes = 3;

std::uint64_t itemOf(const PlistValue& download) {
  return download["metadata"]["itemIdentifier"].uint64Value();
}

std::string titleOf(const PlistValue& download) {
  const std::string* title = download["metadata"]["title"].string();
  return title && !title->empty() ? *title : "item " + std::to_string(itemOf(download));
}

}  // namespace

DownloadFollower::DownloadFollower(ServiceClient& client, bool json)
    : client_(client), json_(json) {
  client_.watchDownloadEndings(
      [inbox = inbox_](const PlistValue& download, bool success, const PlistValue& error) {
        {
          MutexLock lock(inbox->mutex);
          inbox->endings.insert_or_assign(itemOf(download), Ending{download, success, error});
        }
        inbox->changed.notify_all();
      });
  client_.watchServiceOwner([inbox = inbox_](bool present) {
    if (present) return;
    {
      MutexLock lock(inbox->mutex);
      inbox->serviceGone = true;
    }
    inbox->changed.notify_all();
  });
}

int DownloadFollower::follow(const PlistArray& started) {
  std::map<std::uint64_t, std::string> pending;
  for (const PlistValue& download : started) pending.emplace(itemOf(download), titleOf(download));
  ProgressBar bar(stderr);
  PlistArray results;
  int status = kExitSuccess;
  while (!pending.empty()) {
    std::map<std::uint64_t, Ending> ended;
    bool gone = false;
    {
      Inbox& inbox = *inbox_;
      MutexLock lock(inbox.mutex);
      if (inbox.endings.empty() && !inbox.serviceGone)
        inbox.changed.wait_for(lock, kProgressInterval);
      for (auto entry = inbox.endings.begin(); entry != inbox.endings.end();) {
        if (pending.contains(entry->first)) {
          ended.insert(inbox.endings.extract(entry++));
        } else {
          ++entry;
        }
      }
      gone = inbox.serviceGone;
    }
    for (const auto& [item, ending] : ended) {
      bar.clear();
      if (!report(ending, pending[item])) status = kExitFailure;
      results.emplace_back(PlistDictionary{
          {"download", ending.download}, {"success", ending.success}, {"error", ending.error}});
      pending.erase(item);
    }
    if (gone && !pending.empty()) {
      bar.clear();
      for (const auto& [item, title] : pending) {
        std::cerr << "larderctl: larderd stopped before the download of " << title << " (item "
                  << item << ") ended; run `larderctl downloads` once it is back" << std::endl;
      }
      return kExitFailure;
    }
    if (!pending.empty()) showProgress(pending, bar);
  }
  if (json_) std::cout << JsonConversion::toJson(results).dump() << std::endl;
  return status;
}

void DownloadFollower::showProgress(const std::map<std::uint64_t, std::string>& pending,
                                    ProgressBar& bar) const {
  const PlistArray reply = client_.callStoreRuntime("Downloads", {kAllDownloadTypes});
  for (const PlistValue& download : *reply.at(0).array()) {
    const auto found = pending.find(itemOf(download));
    if (found == pending.end()) continue;
    bar.show(download["progress"].doubleValue(), found->second);
    return;
  }
}

bool DownloadFollower::report(const Ending& ending, const std::string& title) const {
  if (ending.success) {
    const std::string* path = ending.download["installedPath"].string();
    if (!json_) {
      std::cout << "installed " << title;
      if (path) std::cout << " at " << *path;
      std::cout << std::endl;
    }
    return true;
  }
  if (!json_) {
    const std::string* description = ending.error["description"].string();
    std::cerr << "larderctl: the download of " << title << " (item " << itemOf(ending.download)
              << ") failed: " << (description ? *description : "the service gave no reason")
              << " (code " << ending.error["code"].int64Value() << ")" << std::endl;
  }
  return false;
}

}  // namespace larder
