// The one strict UTF-8 check that property lists and DMAP text share: what
// it takes, what it refuses, and that text it takes is left as it is by the
// repair that property lists apply.

#include <gtest/gtest.h>

#include <string>

#include "platform/plist/Utf8.h"

namespace larder {
namespace {

struct Utf8Case {
  const char* what;
  std::string text;
  bool wellFormed;
};

TEST(Utf8Test, TakesWellFormedTextAndRefusesTheRest) {
  const std::string eight(8, 'a');
  const Utf8Case cases[] = {
      {"empty", "", true},
      {"a zero byte", std::string("a\0b", 3), true},
      {"two bytes", "caf\xC3\xA9", true},
      {"three bytes", "\xE2\x82\xAC", true},
      {"four bytes", "\xF0\x9F\x98\x80", true},
      {"a genuine U+FFFD", "\xEF\xBF\xBD", true},
      {"the last code point", "\xF4\x8F\xBF\xBF", true},
      {"overlong two bytes", "\xC0\xAF", false},
      {"overlong three bytes", "\xE0\x80\xAF", false},
      {"overlong four bytes", "\xF0\x80\x80\xAF", false},
      {"an encoded surrogate", "\xED\xA0\x80", false},
      {"above U+10FFFF", "\xF4\x90\x80\x80", false},
      {"a lead byte beyond F4", "\xF5\x80\x80\x80", false},
      {"a truncated sequence", "\xE2\x82", false},
      {"a lone continuation byte", "\x80", false},
      {"a broken continuation", "\xE2\x28\xA1", false},
      // ASCII is skipped eight bytes at a time: what follows a whole run,
      // and what sits inside a second one, is still looked at.
      {"bad byte after eight ASCII", eight + "\xFF", false},
      {"bad byte ending a run", std::string(7, 'a') + "\x80" + eight, false},
      {"bad byte inside the second run", eight + "abc\x80" + "defg", false},
      {"truncated after two runs", eight + eight + "\xC3", false},
      {"good text between runs", eight + "\xC3\xA9" + eight + "b", true},
  };
  for (const Utf8Case& sample : cases) {
    EXPECT_EQ(isWellFormedUtf8(sample.text), sample.wellFormed) << sample.what;
    EXPECT_EQ(toWellFormedUtf8(sample.text) == sample.text, sample.wellFormed) << sample.what;
  }
}

}  // namespace
}  // namespace larder
