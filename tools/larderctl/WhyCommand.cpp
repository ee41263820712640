#include "tools/larderctl/WhyCommand.h"

#include <algorithm>
#include <iostream>

#include "platform/plist/JsonConversion.h"
#include "tools/larderctl/ExitStatus.h"
#include "tools/larderctl/RunsCommand.h"
#include "tools/larderctl/UpdateExplanation.h"
#include "tools/larderctl/ValueText.h"

namespace larder {

namespace {

bool isNumber(const std::string& word) {
  return !word.empty() && word.find_first_not_of("0123456789") == std::string::npos;
}

bool sameText(const PlistValue& value, const std::string& word) {
  const std::string* text = value.string();
  return text && std::ranges::equal(*text, word, [](char a, char b) {
           return std::tolower(static_cast<unsigned char>(a)) ==
                  std::tolower(static_cast<unsigned char>(b));
         });
}

// An app update is named by its item identifier, bundle identifier or
// title; an OS update by its product key or title. The journal keeps the
// store's own keys for apps.
bool namesApp(const PlistValue& update, const std::string& target, std::string_view itemKey,
              std::string_view bundleKey) {
  if (isNumber(target)) return std::to_string(update[itemKey].uint64Value()) == target;
  return sameText(update[bundleKey], target) || sameText(update["title"], target);
}

bool namesOS(const PlistValue& update, const std::string& target) {
  return sameText(update["productKey"], target) || sameText(update["title"], target);
}

const PlistValue* findIf(const PlistValue& list, const auto& predicate) {
  const PlistArray* array = list.array();
  if (!array) return nullptr;
  auto found = std::ranges::find_if(*array, predicate);
  return found == array->end() ? nullptr : &*found;
}

// The newest entry: the journal is kept oldest first.
const PlistValue* findLast(const PlistValue& list, const auto& predicate) {
  const PlistArray* array = list.array();
  if (!array) return nullptr;
  auto found = std::ranges::find_if(array->rbegin(), array->rend(), predicate);
  return found == array->rend() ? nullptr : &*found;
}

std::string appName(const PlistValue& update, std::string_view itemKey) {
  const std::string item = std::to_string(update[itemKey].uint64Value());
  const std::string* title = update["title"].string();
  return title ? *title + " (" + item + ")" : item;
}

std::optional<std::string> textOf(const PlistValue& value) {
  if (const std::string* text = value.string()) return *text;
  return std::nullopt;
}

std::string explainAudited(const WhyCommand::Facts& facts) {
  const PlistValue& entry = *facts.audited;
  const auto kind = facts.osUpdate ? UpdateExplanation::Kind::kOS : UpdateExplanation::Kind::kApp;
  if (!entry["shouldInstall"].boolValue()) {
    return UpdateExplanation::abortCode(entry["abortCode"].int64Value(),
                                        textOf(entry["abortReason"]), kind);
  }
  if (!facts.listed) return "installed by the last background run";
  // Meant to go in, still offered: the install itself went wrong, and the
  // code it left on the update says how when it says anything.
  const std::int64_t code = (*facts.listed)["autoUpdateAbortCode"].int64Value();
  return code != 0 ? UpdateExplanation::abortCode(code, std::nullopt, kind)
                   : std::string("the last background run tried to install it and failed");
}

}  // namespace

std::vector<std::string> WhyCommand::explain(const Facts& facts) {
  std::vector<std::string> lines;
  const auto kind = facts.osUpdate ? UpdateExplanation::Kind::kOS : UpdateExplanation::Kind::kApp;
  if (facts.audited) {
    lines.push_back(explainAudited(facts));
    lines.push_back("decided by the background run of " + RunsCommand::localTime(facts.runDate));
  } else if (facts.listed && (*facts.listed)["autoUpdateAbortCode"].int64Value() != 0) {
    lines.push_back(UpdateExplanation::abortCode(
        (*facts.listed)["autoUpdateAbortCode"].int64Value(), std::nullopt, kind));
    lines.push_back("recorded on the update by an earlier background run");
  } else if (facts.listed) {
    lines.push_back(
        "no background run has decided on it yet: it is offered and waits for the next run, or "
        "for `larderctl install`");
  } else if (facts.journaled) {
    lines.push_back("installed on " + RunsCommand::localTime((*facts.journaled)["installDate"]));
  }
  if (facts.listed && (*facts.listed)["isStaged"].boolValue()) {
    lines.push_back("it is downloaded and ready to install");
  }
  if (facts.journaled && facts.audited) {
    lines.push_back("installed on " + RunsCommand::localTime((*facts.journaled)["installDate"]));
  }
  return lines;
}

int WhyCommand::run(const std::string& target) {
  const PlistValue apps = client_.call("AvailableUpdates", {}).at(0);
  const PlistValue os = client_.call("UpdatesForTags", PlistArray{PlistValue(PlistArray{})}).at(0);
  const PlistValue journal = client_.call("InstalledUpdatesJournal", {}).at(0);
  const PlistValue audit(RunsCommand::readLastAudit());

  Facts facts{.runDate = audit["runDate"]};
  auto isApp = [&](const PlistValue& entry) {
    return !entry["__isSoftwareUpdate"].boolValue() &&
           namesApp(entry, target, "ware-id", "bundle-id");
  };
  auto isOS = [&](const PlistValue& entry) {
    return entry["__isSoftwareUpdate"].boolValue() && namesOS(entry, target);
  };
  facts.listed = findIf(apps, [&](const PlistValue& update) {
    return namesApp(update, target, "itemIdentifier", "bundleID");
  });
  facts.journaled = findLast(journal, isApp);
  std::string item;
  if (facts.listed) {
    item = std::to_string((*facts.listed)["itemIdentifier"].uint64Value());
    facts.name = appName(*facts.listed, "itemIdentifier");
  } else if (facts.journaled) {
    item = std::to_string((*facts.journaled)["ware-id"].uint64Value());
    facts.name = appName(*facts.journaled, "ware-id");
  } else if (isNumber(target)) {
    item = target;
    facts.name = target;
  }
  if (const PlistDictionary* audited = audit["appUpdates"].dictionary(); audited && !item.empty()) {
    if (auto found = audited->find(item); found != audited->end()) facts.audited = &found->second;
  }
  if (!facts.listed && !facts.audited && !facts.journaled) {
    facts.osUpdate = true;
    facts.listed = findIf(os, [&](const PlistValue& update) { return namesOS(update, target); });
    facts.journaled = findLast(journal, isOS);
    const PlistValue* named = facts.listed ? facts.listed : facts.journaled;
    const std::string key =
        named ? ValueText::textOr((*named)["productKey"], target.c_str()) : target;
    facts.name = key;
    if (const PlistDictionary* audited = audit["osUpdates"].dictionary()) {
      if (auto found = audited->find(key); found != audited->end()) facts.audited = &found->second;
    }
  }

  const std::vector<std::string> lines = explain(facts);
  if (json_) {
    PlistArray reasons(lines.begin(), lines.end());
    std::cout << JsonConversion::toJson(
                     PlistDictionary{
                         {"update", facts.name},
                         {"kind", facts.osUpdate ? "os" : "app"},
                         {"explanation", std::move(reasons)},
                         {"audit", facts.audited ? *facts.audited : PlistValue(PlistDictionary{})},
                     })
                     .dump()
              << std::endl;
  } else if (lines.empty()) {
    std::cerr << "larderctl: nothing is known of an update \"" << target
              << "\": it is not offered, the last background run did not decide on it, and it "
                 "is not in the installed-updates journal"
              << std::endl;
  } else {
    std::cout << facts.name << ": " << lines.front() << std::endl;
    for (std::size_t index = 1; index < lines.size(); ++index) {
      std::cout << "  " << lines[index] << std::endl;
    }
  }
  return lines.empty() ? kExitNothingToDo : kExitSuccess;
}

}  // namespace larder
