#include "tools/larderctl/UpdateExplanation.h"

#include <array>
#include <utility>

namespace larder {

namespace {

struct Words {
  std::int64_t code;
  const char* text;
  // Whether the recorded reason adds what the words cannot know.
  bool quotesReason;
};

constexpr std::array kAppWords{
    Words{1, "automatic updates are turned off", false},
    Words{3,
          "the application was running; a background run never quits an application, so the "
          "update goes in once it has quit, or at once with `larderctl install`",
          false},
    Words{4, "the update does not say which application it replaces", false},
    Words{5, "the package's own check before installing objected", false},
    Words{6, "buying the update failed", true},
    Words{7, "it was not downloaded because the package's own check before installing failed",
          false},
    Words{100, "the application was running and could not be quit safely", true},
    Words{101, "the application was in front, in use", false},
    Words{103, "the application was asked to quit and did not", false},
    Words{105, "a plug-in of the application was in use by another application", true},
    Words{501, "the update is newer than the age an update must reach before it goes in by itself",
          false},
    Words{502, "it is not yet time for automatic installs", false},
};

constexpr std::array kOSWords{
    Words{100, "an application that had to quit could not be quit safely", true},
    Words{101, "an application that had to quit was in front, in use", true},
    Words{103, "an application that had to quit did not", true},
    Words{104, "the update needs a restart and other users are logged in", false},
    Words{105, "a plug-in of an application that had to quit was in use", true},
    Words{106, "downloading it ahead of the install later failed", true},
    Words{200, "the system does not recommend installing it automatically", false},
    Words{201, "it carries a firmware warning that must be read first", false},
    Words{202, "its licence agreement must be accepted first", false},
};

bool meansWait(std::int64_t code) {
  return code >= 500 && code <= 599;
}

template <std::size_t N>
const Words* find(const std::array<Words, N>& table, std::int64_t code) {
  for (const Words& words : table) {
    if (words.code == code) return &words;
  }
  return nullptr;
}

}  // namespace

std::string UpdateExplanation::abortCode(std::int64_t code,
                                         const std::optional<std::string>& reason, Kind kind) {
  if (code == 0) return "no objection";
  const Words* words = kind == Kind::kApp ? find(kAppWords, code) : find(kOSWords, code);
  std::string text;
  if (words) {
    text = words->text;
    if (words->quotesReason && reason && !reason->empty()) text += " (\"" + *reason + "\")";
  } else {
    // A code a preference imposes, or one this program does not know.
    text = reason && !reason->empty() ? "\"" + *reason + "\"" : "no reason was recorded";
  }
  return std::string(meansWait(code) ? "not yet: " : "held back: ") + text + " (code " +
         std::to_string(code) + ")";
}

}  // namespace larder
