#include "tools/larderctl/PreferencesCommand.h"

#include <gtest/gtest.h>

namespace larder {
namespace {

TEST(PreferenceValueWords, AreTypedByTheirLookOrByTheGivenType) {
  struct Case {
    const char* word;
    const char* type;
    PlistValue expected;
  } const cases[] = {
      {"true", "", true},
      {"false", "", false},
      {"42", "", std::int64_t{42}},
      {"-3", "", std::int64_t{-3}},
      {"2.5", "", 2.5},
      {"2026-11-25T10:00:00Z", "", PlistDate{1795600800}},
      {"[1,\"a\"]", "", PlistArray{std::int64_t{1}, "a"}},
      {"{\"k\":true}", "", PlistDictionary{{"k", true}}},
      {"[not json", "", "[not json"},
      {"hello", "", "hello"},
      {"42", "string", "42"},
      {"true", "string", "true"},
      {"yes", "bool", true},
      {"0", "bool", false},
      {"7", "real", 7.0},
      {"2026-11-25", "date", PlistDate{1795564800}},
      {"[]", "json", PlistArray{}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(std::string(c.word) + " as '" + c.type + "'");
    EXPECT_EQ(PreferencesCommand::valueOf(c.word, c.type), c.expected);
  }
  for (auto [word, type] : {std::pair{"maybe", "bool"},
                            {"1.5", "integer"},
                            {"inf", "real"},
                            {"tomorrow", "date"},
                            {"\"text\"", "json"},
                            {"{", "json"}}) {
    SCOPED_TRACE(std::string(word) + " as " + type);
    EXPECT_ANY_THROW((void)PreferencesCommand::valueOf(word, type));
  }
}

}  // namespace
}  // namespace larder
