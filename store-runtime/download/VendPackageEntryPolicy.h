#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace larder {

// Decides, entry by entry, whether a package may be extracted. A package
// holds exactly one top-level "<Name>.app" folder, and nothing in it may
// reach outside that folder: no absolute or climbing paths, no links that
// resolve outside it (a link's target may climb with ".." only at its
// start), no devices, no second top-level item. Stateful: the first entry
// fixes the bundle folder's name for the rest.
class VendPackageEntryPolicy {
 public:
  enum class Kind { kFile, kDirectory, kSymlink, kHardLink, kOther };

  struct Entry {
    std::string pathname;
    Kind kind = Kind::kFile;
    // The target of a symbolic link, or the entry a hard link repeats.
    std::string linkTarget;
    bool sparse = false;
  };

  struct Decision {
    bool allowed = false;
    std::string reason;  // why not, for people
    // Where the entry goes, relative to the bundle folder ("bin/tool"); empty
    // for the bundle folder itself and for "." entries, which need nothing.
    std::string relativePath;
    // For a hard link: the entry it repeats, relative to the bundle folder.
    std::string hardLinkRelativePath;
  };

  Decision judge(const Entry& entry);

  // The "<Name>.app" of the entries judged so far; empty before the first.
  [[nodiscard]] const std::string& bundleFolderName() const { return bundleFolderName_; }

 private:
  struct Place {
    std::vector<std::string> insideBundle;  // components below the bundle folder
    std::string refusal;
    bool isDotEntry = false;
  };

  Place place(std::string_view pathname);
  static std::optional<std::string> symlinkEscape(const std::vector<std::string>& linkPlace,
                                                  std::string_view target);

  std::string bundleFolderName_;
};

}  // namespace larder
