#include "tools/larderctl/HistoryCommand.h"

#include <algorithm>
#include <array>
#include <chrono>
#include <cmath>
#include <ctime>
#include <iomanip>
#include <iostream>
#include <sstream>

#include "platform/plist/JsonConversion.h"
#include "tools/larderctl/ExitStatus.h"
#include "tools/larderctl/ValueText.h"

namespace larder {
namespace {

constexpr double kSecondsPerDay = 86400;

std::optional<double> installDateOf(const PlistValue& entry) {
  const PlistValue& date = entry["installDate"];
  if (const PlistDate* value = date.date()) return value->secondsSince1970;
  if (date.isReal() || date.isInteger()) return date.doubleValue();
  return std::nullopt;
}

// "2026-01-15 11:00": a history is read by the day and the hour.
std::string localMinute(std::optional<double> secondsSince1970) {
  if (!secondsSince1970 || !std::isfinite(*secondsSince1970)) return "-";
  const auto seconds = static_cast<std::time_t>(std::floor(*secondsSince1970));
  std::tm local{};
  if (::localtime_r(&seconds, &local) == nullptr) return "-";
  std::array<char, 32> text{};
  const std::size_t length = std::strftime(text.data(), text.size(), "%Y-%m-%d %H:%M", &local);
  return std::string(text.data(), length);
}

double secondsNow() {
  using Seconds = std::chrono::duration<double>;
  return Seconds(std::chrono::system_clock::now().time_since_epoch()).count();
}

}  // namespace

PlistArray HistoryCommand::newestFirst(const PlistArray& journal, std::optional<double> sinceDays,
                                       double now) {
  PlistArray selected;
  for (const PlistValue& entry : journal) {
    if (!entry.dictionary()) continue;
    const std::optional<double> date = installDateOf(entry);
    if (sinceDays && (!date || *date < now - *sinceDays * kSecondsPerDay)) continue;
    selected.push_back(entry);
  }
  // The journal is oldest first, but an OS update confirmed after a logout
  // is added at its end with the date of its request; entries without a
  // date go last.
  std::ranges::stable_sort(selected, [](const PlistValue& left, const PlistValue& right) {
    return installDateOf(left).value_or(-INFINITY) > installDateOf(right).value_or(-INFINITY);
  });
  return selected;
}

std::string HistoryCommand::table(const PlistArray& entries) {
  std::ostringstream text;
  text << std::left << std::setw(32) << "TITLE" << std::setw(14) << "VERSION" << std::setw(18)
       << "DATE" << std::setw(6) << "KIND"
       << "PENDING" << '\n';
  for (const PlistValue& entry : entries) {
    const bool os = entry["__isSoftwareUpdate"].boolValue();
    const bool pending = entry["__postLogoutInstallPending"].boolValue();
    std::ostringstream row;
    row << std::left << std::setw(32) << ValueText::textOr(entry["title"]) << std::setw(14)
        << ValueText::textOr(entry["version"]) << std::setw(18) << localMinute(installDateOf(entry))
        << std::setw(6) << (os ? "OS" : "app") << (pending ? "yes" : "");
    std::string line = row.str();
    while (!line.empty() && line.back() == ' ') line.pop_back();
    text << line << '\n';
  }
  return text.str();
}

int HistoryCommand::run(std::optional<double> sinceDays) {
  const PlistValue journal = client_.call("InstalledUpdatesJournal", {}).at(0);
  const PlistArray entries =
      newestFirst(journal.array() ? *journal.array() : PlistArray{}, sinceDays, secondsNow());
  if (json_) {
    std::cout << JsonConversion::toJson(PlistValue(entries)).dump() << std::endl;
  } else if (entries.empty()) {
    std::cout << "nothing installed in the last " << (sinceDays ? *sinceDays : 30.0) << " days"
              << std::endl;
  } else {
    std::cout << table(entries) << std::flush;
  }
  return entries.empty() ? kExitNothingToDo : kExitSuccess;
}

}  // namespace larder
