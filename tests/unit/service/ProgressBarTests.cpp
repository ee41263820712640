// larderctl's progress line: its bar, its figure, and what it does off a
// terminal.
#include <gtest/gtest.h>

#include <cmath>
#include <cstdio>
#include <limits>

#include "tools/larderctl/ProgressBar.h"

namespace larder {
namespace {

TEST(ProgressBar, TheBarAndTheFigureFollowTheFractionWithinItsBounds) {
  EXPECT_EQ(ProgressBar::render(0, "Atlas", 10), "[..........]   0%  Atlas");
  EXPECT_EQ(ProgressBar::render(0.456, "Atlas", 10), "[####......]  45%  Atlas");
  EXPECT_EQ(ProgressBar::render(1, "", 4), "[####] 100%  ");
  EXPECT_EQ(ProgressBar::render(7.5, "x", 4), "[####] 100%  x");
  EXPECT_EQ(ProgressBar::render(-1, "x", 4), "[....]   0%  x");
  EXPECT_EQ(ProgressBar::render(std::numeric_limits<double>::quiet_NaN(), "x", 4),
            "[....]   0%  x");
}

TEST(ProgressBar, OffATerminalNothingIsDrawn) {
  std::FILE* file = std::tmpfile();
  ASSERT_NE(file, nullptr);
  {
    ProgressBar bar(file);
    bar.show(0.5, "Atlas");
    bar.clear();
  }
  EXPECT_EQ(std::ftell(file), 0L);
  std::fclose(file);
}

}  // namespace
}  // namespace larder
