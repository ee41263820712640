#pragma once

#include <atomic>
#include <concepts>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <type_traits>
#include <variant>
#include <vector>

#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"

namespace larder {

std::string describePlistValue(const PlistValue& value);

// One argument of a log format. Numbers keep their value, so that a
// conversion such as "%.4f" or "%lu" prints them as printf would; anything
// else is its description: records describe themselves, property lists
// print as text, null pointers as "(null)". "%@" takes any argument.
// A text longer than `kMaxTextBytes` is cut there and followed by its full
// length, "…(10485760 bytes)"; what must be kept whole goes to a side file.
class LogArgument {
 public:
  static constexpr std::size_t kMaxTextBytes = 4096;

  LogArgument(std::string text) : value_(std::move(text)) {}  // NOLINT(google-explicit-constructor)
  LogArgument(const char* text)
      : value_(std::string(text)) {}  // NOLINT(google-explicit-constructor)
  LogArgument(std::string_view text)
      : value_(std::string(text)) {}  // NOLINT(google-explicit-constructor)
  template <typename Number>
  requires std::is_arithmetic_v<Number>
  static LogArgument number(Number value) {
    LogArgument argument("");
    if constexpr (std::is_floating_point_v<Number>) {
      argument.value_ = static_cast<double>(value);
    } else if constexpr (std::is_signed_v<Number>) {
      argument.value_ = static_cast<long long>(value);
    } else {
      argument.value_ = static_cast<unsigned long long>(value);
    }
    return argument;
  }

  // The argument as the conversion ("%@", "%.4f", "%ld"...) prints it.
  [[nodiscard]] std::string render(std::string_view conversion) const;

 private:
  std::variant<std::string, long long, unsigned long long, double> value_;
};

template <typename T>
LogArgument describeLogArgument(const T& argument) {
  using Plain = std::remove_cvref_t<T>;
  if constexpr (std::is_same_v<Plain, bool>) {
    return LogArgument::number(argument ? 1 : 0);
  } else if constexpr (std::is_arithmetic_v<Plain>) {
    return LogArgument::number(argument);
  } else if constexpr (std::is_convertible_v<const T&, std::string_view>) {
    return std::string(std::string_view(argument));
  } else if constexpr (std::is_same_v<Plain, PlistValue>) {
    return describePlistValue(argument);
  } else if constexpr (requires { argument.description(); }) {
    return argument.description();
  } else if constexpr (requires { argument->description(); }) {
    return argument ? argument->description() : std::string("(null)");
  } else if constexpr (requires {
                         argument.has_value();
                         *argument;
                       }) {
    return argument ? describeLogArgument(*argument) : LogArgument("(null)");
  } else {
    static_assert(sizeof(T) == 0, "no description for this log argument");
  }
}

// The service's log. Levels: 1 errors, warnings and decisions that support
// needs; 2 events of a run; 3 detail. Lines go to standard error with a
// syslog priority prefix, so the journal files them by level; large
// property lists go to side files in the state folder.
class TillLogManager {
 public:
  using Sink = std::function<void(int level, const std::string& line)>;

  static TillLogManager& sharedManager();

  [[nodiscard]] bool isEnabled(int level) const { return level <= level_.load(); }
  void setLevel(int level) { level_.store(level); }
  [[nodiscard]] int level() const { return level_.load(); }

  template <typename... Arguments>
  void logLevel(int level, std::string_view function, std::string_view file, int line,
                std::string_view format, const Arguments&... arguments) {
    if (!isEnabled(level)) return;
    logWithDescribedArguments(level, function, file, line, format,
                              {describeLogArgument(arguments)...});
  }

  // The same with arguments already described.
  void logWithDescribedArguments(int level, std::string_view function, std::string_view file,
                                 int line, std::string_view format,
                                 const std::vector<LogArgument>& described) {
    if (!isEnabled(level)) return;
    write(level, function, file, line, formatMessage(format, described));
  }

  // Writes `plist` as XML to "<state folder>/<filename>.plist".
  void logLevelForPlist(int level, std::string_view function, std::string_view file, int line,
                        const PlistValue& plist, std::string_view filename);

  // Adds a receiver of every written line, for tests and tools; returns a
  // handle that removes it when destroyed.
  std::shared_ptr<void> addSink(Sink sink);

  static std::string formatMessage(std::string_view format, const std::vector<LogArgument>& args);

 private:
  TillLogManager();
  void write(int level, std::string_view function, std::string_view file, int line,
             const std::string& message);

  std::atomic<int> level_;
  Mutex sinksMutex_;
  std::vector<std::shared_ptr<Sink>> sinks_ GUARDED_BY(sinksMutex_);
};

// Non-zero when debug logging is on (LARDER_DEBUG set to a non-zero value).
int TillDebugLevel();

}  // namespace larder

// Every call states its level; the arguments are evaluated only when the
// level is enabled.
#define TILL_LOG(level, ...)                                                      \
  do {                                                                            \
    auto& tillLogManager_ = ::larder::TillLogManager::sharedManager();            \
    if (tillLogManager_.isEnabled(level))                                         \
      tillLogManager_.logLevel(level, __func__, __FILE__, __LINE__, __VA_ARGS__); \
  } while (false)

#define TILL_LOG_PLIST(level, plist, filename)                                                \
  do {                                                                                        \
    auto& tillLogManager_ = ::larder::TillLogManager::sharedManager();                        \
    if (tillLogManager_.isEnabled(level))                                                     \
      tillLogManager_.logLevelForPlist(level, __func__, __FILE__, __LINE__, plist, filename); \
  } while (false)
