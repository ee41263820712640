#include "store-runtime/records/RecordDateText.h"

#include <charconv>
#include <chrono>

namespace larder {

namespace {

// Reads exactly `digits` digits from the front of `text`.
std::optional<int> takeNumber(std::string_view& text, std::size_t digits) {
  if (text.size() < digits) return std::nullopt;
  int number = 0;
  const auto [end, failure] = std::from_chars(text.data(), text.data() + digits, number);
  if (failure != std::errc() || end != text.data() + digits) return std::nullopt;
  text.remove_prefix(digits);
  return number;
}

bool take(std::string_view& text, char expected) {
  if (text.empty() || text.front() != expected) return false;
  text.remove_prefix(1);
  return true;
}

std::optional<double> daySeconds(std::string_view text) {
  const auto year = takeNumber(text, 4);
  if (!year || !take(text, '-')) return std::nullopt;
  const auto month = takeNumber(text, 2);
  if (!month || !take(text, '-')) return std::nullopt;
  const auto day = takeNumber(text, 2);
  if (!day || !text.empty()) return std::nullopt;
  const std::chrono::year_month_day date{std::chrono::year(*year),
                                         std::chrono::month(static_cast<unsigned>(*month)),
                                         std::chrono::day(static_cast<unsigned>(*day))};
  if (!date.ok()) return std::nullopt;
  const auto days = std::chrono::sys_days(date).time_since_epoch();
  return static_cast<double>(std::chrono::duration_cast<std::chrono::seconds>(days).count());
}

// "+HH:MM", "-HHMM" or "Z", as seconds east of UTC.
std::optional<double> zoneOffset(std::string_view text) {
  if (text == "Z" || text.empty()) return 0.0;
  const char sign = text.front();
  if (sign != '+' && sign != '-') return std::nullopt;
  text.remove_prefix(1);
  const auto hours = takeNumber(text, 2);
  take(text, ':');
  const auto minutes = takeNumber(text, 2);
  if (!hours || !minutes || !text.empty() || *hours > 23 || *minutes > 59) return std::nullopt;
  const double offset = *hours * 3600.0 + *minutes * 60.0;
  return sign == '+' ? offset : -offset;
}

// "HH:MM:SS[.fraction]" followed by the zone.
std::optional<double> timeSeconds(std::string_view text) {
  const auto hours = takeNumber(text, 2);
  if (!hours || !take(text, ':')) return std::nullopt;
  const auto minutes = takeNumber(text, 2);
  if (!minutes || !take(text, ':')) return std::nullopt;
  const auto seconds = takeNumber(text, 2);
  if (!seconds || *hours > 23 || *minutes > 59 || *seconds > 60) return std::nullopt;
  double fraction = 0;
  if (take(text, '.')) {
    const std::size_t digits = text.find_first_not_of("0123456789");
    const std::string_view part = text.substr(0, digits);
    if (part.empty()) return std::nullopt;
    for (auto it = part.rbegin(); it != part.rend(); ++it) fraction = (fraction + (*it - '0')) / 10;
    text.remove_prefix(part.size());
  }
  const auto offset = zoneOffset(text);
  if (!offset) return std::nullopt;
  return *hours * 3600.0 + *minutes * 60.0 + *seconds + fraction - *offset;
}

}  // namespace

std::optional<PlistDate> RecordDateText::parse(std::string_view text) {
  constexpr std::size_t kDateLength = 10;  // YYYY-MM-DD
  const auto day = daySeconds(text.substr(0, kDateLength));
  if (!day) return std::nullopt;
  if (text.size() == kDateLength) return PlistDate{*day};
  const char separator = text[kDateLength];
  if (separator != 'T' && separator != ' ') return std::nullopt;
  const auto time = timeSeconds(text.substr(kDateLength + 1));
  if (!time) return std::nullopt;
  return PlistDate{*day + *time};
}

}  // namespace larder
