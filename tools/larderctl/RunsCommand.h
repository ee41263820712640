#pragma once

#include <string>

#include "client/ServiceClient.h"
#include "platform/value/PlistValue.h"

namespace larder {

// `larderctl runs`: what the update machinery is doing and what its last
// background run decided. The downloads under way come from the service;
// the decisions come from the audit the service leaves in the user's caches
// after each background run, joined with the updates still listed.
class RunsCommand {
 public:
  RunsCommand(ServiceClient& client, bool json) : client_(client), json_(json) {}

  // 0 when a run has been recorded; 3 when none has yet.
  int run();

  // "<caches>/com.orvane.larderd/UpdateOperationAudit.plist".
  static std::string auditFilePath();
  // The audit of the last background run; empty when none was recorded or
  // the file does not parse.
  static PlistDictionary readLastAudit();
  // "2024-05-01 10:00:00" in local time.
  static std::string localTime(const PlistValue& date);
  // What became of one app update: "installed", "staged", "staged, held
  // back: <reason> (code N)", "held back: <reason> (code N)", "install
  // failed", from its audit entry and its record if it is still listed.
  static std::string outcome(const PlistValue& entry, const PlistValue* listed);

 private:
  void printInProgress(const PlistArray& downloads) const;
  void printLastRun(const PlistDictionary& audit, const PlistArray& listed) const;

  ServiceClient& client_;
  bool json_;
};

}  // namespace larder
