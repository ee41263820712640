#include "platform/system/Confinement.h"

#include <fcntl.h>
#include <linux/landlock.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/system/Environment.h"
#include "platform/system/FileDescriptor.h"

namespace larder {

namespace {

constexpr std::uint64_t kWriteAccess =
    LANDLOCK_ACCESS_FS_WRITE_FILE | LANDLOCK_ACCESS_FS_REMOVE_DIR | LANDLOCK_ACCESS_FS_REMOVE_FILE |
    LANDLOCK_ACCESS_FS_MAKE_CHAR | LANDLOCK_ACCESS_FS_MAKE_DIR | LANDLOCK_ACCESS_FS_MAKE_REG |
    LANDLOCK_ACCESS_FS_MAKE_SOCK | LANDLOCK_ACCESS_FS_MAKE_FIFO | LANDLOCK_ACCESS_FS_MAKE_BLOCK |
    LANDLOCK_ACCESS_FS_MAKE_SYM;

bool allowWritesBelow(int ruleset, const std::string& folder) {
  FileDescriptor directory(::open(folder.c_str(), O_PATH | O_CLOEXEC));
  if (directory.get() < 0) return errno == ENOENT;  // a folder not there needs no rule
  landlock_path_beneath_attr rule{};
  rule.allowed_access = kWriteAccess;
  rule.parent_fd = directory.get();
  return ::syscall(SYS_landlock_add_rule, ruleset, LANDLOCK_RULE_PATH_BENEATH, &rule, 0) == 0;
}

// Landlock is an extra wall, not a requirement: a kernel without it (or
// with it switched off) leaves the process as it is.
// The failure of a system call, by the errno it left.
VendError confinementError(const std::string& what) {
  const int code = errno;
  return VendError::withDomain(std::string(Confinement::kErrorDomain), code,
                               what + ": " + std::strerror(code));
}

Result<void> restrictWrites(const std::vector<std::string>& folders) {
  landlock_ruleset_attr attributes{};
  attributes.handled_access_fs = kWriteAccess;
  int ruleset =
      static_cast<int>(::syscall(SYS_landlock_create_ruleset, &attributes, sizeof attributes, 0));
  if (ruleset < 0) {
    if (errno == ENOSYS || errno == EOPNOTSUPP || errno == EINVAL) return {};
    return confinementError("landlock ruleset");
  }
  FileDescriptor owned(ruleset);
  for (const std::string& folder : folders) {
    if (!allowWritesBelow(ruleset, folder)) return confinementError("landlock rule for " + folder);
  }
  if (::syscall(SYS_landlock_restrict_self, ruleset, 0) != 0) return confinementError("landlock");
  return {};
}

}  // namespace

std::vector<std::string> Confinement::writableFolders(std::string_view /*profileName*/) {
  // The platform root holds the application folders and the simulated
  // platform state; the rest are the user's own folders of the service.
  return {Environment::platformRoot(),        Environment::homeDirectory(),
          Environment::cacheHome(),           Environment::stateDirectory(),
          Environment::userConfigDirectory(), "/tmp"};
}

Result<void> Confinement::confine(std::string_view profileName) {
  if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) return confinementError("no_new_privs");
  return restrictWrites(writableFolders(profileName));
}

}  // namespace larder
