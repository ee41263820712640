#include "store-runtime/download/VendPackageEntryPolicy.h"

namespace larder {

namespace {

std::vector<std::string_view> components(std::string_view path) {
  std::vector<std::string_view> parts;
  std::size_t start = 0;
  while (start <= path.size()) {
    const std::size_t end = path.find('/', start);
    const std::string_view part =
        path.substr(start, end == std::string_view::npos ? std::string_view::npos : end - start);
    if (!part.empty() && part != ".") parts.push_back(part);
    if (end == std::string_view::npos) break;
    start = end + 1;
  }
  return parts;
}

bool isBundleFolderName(std::string_view name) {
  return name.size() > 4 && name.ends_with(".app");
}

std::string joined(const std::vector<std::string>& parts) {
  std::string text;
  for (const std::string& part : parts) {
    if (!text.empty()) text += '/';
    text += part;
  }
  return text;
}

VendPackageEntryPolicy::Decision refuse(std::string reason) {
  VendPackageEntryPolicy::Decision decision;
  decision.reason = std::move(reason);
  return decision;
}

}  // namespace

VendPackageEntryPolicy::Place VendPackageEntryPolicy::place(std::string_view pathname) {
  Place result;
  if (pathname.empty()) {
    result.refusal = "an entry has no name";
    return result;
  }
  if (pathname.front() == '/') {
    result.refusal = "\"" + std::string(pathname) + "\" is an absolute path";
    return result;
  }
  const std::vector<std::string_view> parts = components(pathname);
  if (parts.empty()) {
    result.isDotEntry = true;
    return result;
  }
  for (std::string_view part : parts) {
    if (part == "..") {
      result.refusal = "\"" + std::string(pathname) + "\" climbs out with \"..\"";
      return result;
    }
  }
  const std::string_view top = parts.front();
  if (!isBundleFolderName(top)) {
    result.refusal = "\"" + std::string(pathname) + "\" lies outside a top-level .app folder";
    return result;
  }
  if (bundleFolderName_.empty()) {
    bundleFolderName_ = std::string(top);
  } else if (top != bundleFolderName_) {
    result.refusal = "the package holds a second top-level folder, \"" + std::string(top) +
                     "\", besides \"" + bundleFolderName_ + "\"";
    return result;
  }
  for (std::size_t i = 1; i < parts.size(); ++i) result.insideBundle.emplace_back(parts[i]);
  return result;
}

std::optional<std::string> VendPackageEntryPolicy::symlinkEscape(
    const std::vector<std::string>& linkPlace, std::string_view target) {
  if (target.empty()) return "has an empty target";
  if (target.front() == '/') return "points to the absolute path \"" + std::string(target) + "\"";
  // A name in a target may be another link of the package, and a ".."
  // after it climbs from wherever that link leads, not from the folder its
  // name suggests: a chain of such links leaves the bundle while each one
  // looks contained by name. So ".." may only lead a target. Climbing from
  // the link's own folder is then exact, because that folder and those
  // above it are real folders (nothing is extracted through a link), and
  // every link a target then descends through is held to the same rule.
  std::size_t depth = linkPlace.empty() ? 0 : linkPlace.size() - 1;
  bool descended = false;
  for (std::string_view part : components(target)) {
    if (part != "..") {
      descended = true;
    } else if (descended) {
      return "climbs with \"..\" after a name, which may be a link (\"" + std::string(target) +
             "\")";
    } else if (depth == 0) {
      return "points outside the bundle (\"" + std::string(target) + "\")";
    } else {
      --depth;
    }
  }
  return std::nullopt;
}

VendPackageEntryPolicy::Decision VendPackageEntryPolicy::judge(const Entry& entry) {
  if (entry.kind == Kind::kOther) {
    return refuse("\"" + entry.pathname + "\" is a device, pipe or socket");
  }
  if (entry.sparse) return refuse("\"" + entry.pathname + "\" is a sparse file");
  Place where = place(entry.pathname);
  if (!where.refusal.empty()) return refuse(std::move(where.refusal));
  Decision decision;
  decision.allowed = true;
  if (where.isDotEntry) {
    if (entry.kind != Kind::kDirectory) return refuse("the package's \".\" entry is not a folder");
    return decision;
  }
  if (where.insideBundle.empty() && entry.kind != Kind::kDirectory) {
    return refuse("the top-level \"" + bundleFolderName_ + "\" is not a folder");
  }
  if (entry.kind == Kind::kSymlink) {
    if (std::optional<std::string> escape = symlinkEscape(where.insideBundle, entry.linkTarget)) {
      return refuse("the link \"" + entry.pathname + "\" " + *escape);
    }
  }
  if (entry.kind == Kind::kHardLink) {
    Place target = place(entry.linkTarget);
    if (!target.refusal.empty()) {
      return refuse("the hard link \"" + entry.pathname +
                    "\" repeats an entry outside the bundle: " + target.refusal);
    }
    if (target.insideBundle.empty()) {
      return refuse("the hard link \"" + entry.pathname + "\" repeats the bundle folder");
    }
    decision.hardLinkRelativePath = joined(target.insideBundle);
  }
  decision.relativePath = joined(where.insideBundle);
  return decision;
}

}  // namespace larder
