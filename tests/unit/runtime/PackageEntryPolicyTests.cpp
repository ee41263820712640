// Symbolic links judged one package at a time: chains, loops and links to
// links must never lead out of the bundle, while ordinary links inside it
// stay allowed.
#include <gtest/gtest.h>

#include <string>
#include <utility>
#include <vector>

#include "store-runtime/download/VendPackageEntryPolicy.h"

namespace larder {
namespace {

using Kind = VendPackageEntryPolicy::Kind;
using Links = std::vector<std::pair<std::string, std::string>>;  // name, target

struct LinkCase {
  std::string name;
  Links links;
  bool allowed;
};

// Eight folders deep, a link back up to the bundle folder; a second link
// walks through it one level further, to the folder above the bundle; a
// third reads a system file through the second.
Links chainOutOfTheBundle() {
  const std::string deep = "a/b/c/d/e/f/g/h";
  std::string eightUp;
  for (int i = 0; i < 8; ++i) eightUp += "../";
  return {{"X.app/" + deep + "/up", eightUp},
          {"X.app/out", deep + "/up/" + eightUp + ".."},
          {"X.app/passwd", "out/etc/passwd"}};
}

std::vector<LinkCase> linkCases() {
  return {
      {"chain of links out of the bundle", chainOutOfTheBundle(), false},
      {"through a link to its folder and up",
       {{"X.app/a/up", ".."}, {"X.app/b", "a/up/../.."}},
       false},
      {"loop that climbs", {{"X.app/loop", "loop/.."}}, false},
      {"absolute target", {{"X.app/passwd", "/etc/passwd"}}, false},
      {"absolute target into the bundle's own name", {{"X.app/a", "/X.app/a"}}, false},
      {"more levels up than the link is deep", {{"X.app/bin/tool", "../../x"}}, false},
      {"link to a link inside",
       {{"X.app/bin/tool", "../lib/current/tool"}, {"X.app/lib/current", "v2"}},
       true},
      {"loop of two links inside", {{"X.app/a", "b"}, {"X.app/b", "a"}}, true},
      {"relative link to a sibling folder", {{"X.app/bin/tool", "../resources/./data"}}, true},
      {"deep link back to the bundle folder", {chainOutOfTheBundle().front()}, true},
  };
}

// True when the policy allows every link of the package.
bool allowsAll(const Links& links, std::string* refusal) {
  VendPackageEntryPolicy policy;
  EXPECT_TRUE(policy.judge({"X.app/", Kind::kDirectory, "", false}).allowed);
  for (const auto& [name, target] : links) {
    const VendPackageEntryPolicy::Decision decision =
        policy.judge({name, Kind::kSymlink, target, false});
    if (!decision.allowed) {
      *refusal = decision.reason;
      return false;
    }
  }
  return true;
}

TEST(VendPackageEntryPolicy, LinksMayNeverLeadOutOfTheBundle) {
  for (const LinkCase& link : linkCases()) {
    std::string refusal;
    EXPECT_EQ(allowsAll(link.links, &refusal), link.allowed) << link.name << ": " << refusal;
    if (!link.allowed) {
      EXPECT_NE(refusal.find("the link \"X.app/"), std::string::npos) << refusal;
    }
  }
}

}  // namespace
}  // namespace larder
