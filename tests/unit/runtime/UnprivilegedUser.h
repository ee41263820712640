// File modes do not bind the superuser, and the tests run as the superuser
// in CI. A check that a folder without write permission is respected runs
// inside an `UnprivilegedUser` scope: the whole process (every thread, since
// the C library changes all of them) takes the unprivileged user's real and
// effective ids, so `access()` answers for that user. The saved ids stay
// the superuser's, which is what lets the scope give them back.
#pragma once

#include <grp.h>
#include <gtest/gtest.h>
#include <sys/types.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

namespace larder::testing {

class UnprivilegedUser {
 public:
  static constexpr uid_t kUser = 65534;
  static constexpr gid_t kGroup = 65534;

  // Hands `tree` (everything below it) to the unprivileged user so that it
  // can reach and write it, then becomes that user. Does nothing for a
  // user who is not the superuser: file modes bind them already.
  explicit UnprivilegedUser(const std::string& tree) {
    if (::geteuid() == 0) failure_ = become(tree);
  }

  ~UnprivilegedUser() {
    if (!changed_) return;
    // The rest of the test binary must not run as the unprivileged user.
    if (::setresuid(0, 0, 0) != 0 || ::setresgid(0, 0, 0) != 0 ||
        ::setgroups(groups_.size(), groups_.data()) != 0) {
      std::abort();
    }
  }

  UnprivilegedUser(const UnprivilegedUser&) = delete;
  UnprivilegedUser& operator=(const UnprivilegedUser&) = delete;

  // Empty when the scope is in force; otherwise why it is not.
  [[nodiscard]] const std::string& failure() const { return failure_; }

 private:
  static std::string fail(const std::string& what) { return what + ": " + std::strerror(errno); }

  std::string become(const std::string& tree) {
    namespace fs = std::filesystem;
    std::error_code code;
    if (::lchown(tree.c_str(), kUser, kGroup) != 0) return fail("lchown " + tree);
    for (auto it = fs::recursive_directory_iterator(tree, code); !code && it != fs::end(it);
         it.increment(code)) {
      if (::lchown(it->path().c_str(), kUser, kGroup) != 0)
        return fail("lchown " + it->path().string());
    }
    if (code) return "walking " + tree + ": " + code.message();
    groups_.resize(static_cast<std::size_t>(::getgroups(0, nullptr)));
    if (::getgroups(static_cast<int>(groups_.size()), groups_.data()) < 0) return fail("getgroups");
    const gid_t group = kGroup;
    if (::setgroups(1, &group) != 0) return fail("setgroups");
    changed_ = true;
    if (::setresgid(kGroup, kGroup, 0) != 0) return fail("setresgid");
    if (::setresuid(kUser, kUser, 0) != 0) return fail("setresuid");
    if (::getuid() != kUser || ::geteuid() != kUser) return "the ids did not change";
    return "";
  }

  bool changed_ = false;
  std::vector<gid_t> groups_;
  std::string failure_;
};

}  // namespace larder::testing
