#include "tools/vtr-manifest/walk.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <string_view>

#include "model/progress_updater.h"
#include "platform/file_manager.h"
#include "tools/vtr-manifest/manifest_render.h"

namespace vtr::manifest_tool {
namespace {

// Whether path is folder or lies below it; both canonical.
bool Within(std::string_view path, std::string_view folder) {
  if (folder == "/") return path.starts_with('/');
  return path == folder || (path.starts_with(folder) && path[folder.size()] == '/');
}

// realpath(3) of path; nullopt with errno set when it cannot be resolved.
std::optional<std::string> RealPath(const std::string& path) {
  char resolved[PATH_MAX];
  if (::realpath(path.c_str(), resolved) == nullptr) return std::nullopt;
  return std::string(resolved);
}

// path absolute, without "." components, repeated or trailing slashes.
std::string AbsoluteText(const std::string& path) {
  std::string absolute = path;
  if (!path.starts_with('/')) {
    char cwd[PATH_MAX];
    absolute = std::string(::getcwd(cwd, sizeof cwd) != nullptr ? cwd : ".") + "/" + path;
  }
  std::string out;
  size_t at = 0;
  while (at <= absolute.size()) {
    size_t end = absolute.find('/', at);
    if (end == std::string::npos) end = absolute.size();
    const std::string_view part = std::string_view(absolute).substr(at, end - at);
    if (!part.empty() && part != ".") {
      out += '/';
      out += part;
    }
    at = end + 1;
  }
  return out.empty() ? "/" : out;
}

}  // namespace

std::string CanonicalItemPath(const std::string& path) {
  const std::string absolute = AbsoluteText(path);
  if (absolute == "/") return absolute;
  const size_t slash = absolute.rfind('/');
  const std::string name = absolute.substr(slash + 1);
  if (name == "..") return RealPath(absolute).value_or(absolute);
  std::optional<std::string> folder = RealPath(slash == 0 ? "/" : absolute.substr(0, slash));
  if (!folder) return absolute;
  return (*folder == "/" ? "" : *folder) + "/" + name;
}

int PrepareWalkOptions(WalkOptions& options, Console& console) {
  const std::string given = options.tree;
  std::optional<std::string> tree = RealPath(given);
  if (!tree) {
    const int error = errno;
    console.print("vtr-manifest: " + EscapedText(given) + ": " + std::strerror(error));
    return error == ENOENT || error == ENOTDIR || error == EACCES ? kExitNoInput : kExitBadInput;
  }
  options.tree = std::move(*tree);
  struct stat st;
  if (::stat(options.tree.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
    console.print("vtr-manifest: " + EscapedText(given) + " is not a directory: a manifest describes a tree");
    return kExitBadInput;
  }
  if (options.relativeTo) {
    const std::string relativeTo = *options.relativeTo;
    std::optional<std::string> real = RealPath(relativeTo);
    if (!real || !Within(options.tree, *real)) {
      console.print("vtr-manifest: --relative-to " + EscapedText(relativeTo) + " must be " + EscapedText(given) +
                    " or a folder above it: the keys are the paths below it");
      return kExitUsage;
    }
    options.relativeTo = std::move(*real);
  }
  for (std::string& skip : options.skip) {
    std::string resolved = CanonicalItemPath(skip.starts_with('/') ? skip : options.tree + "/" + skip);
    // A relative path is taken below the tree; one that names nothing there
    // but names something in the tree from the current folder means that.
    struct stat item;
    if (!skip.starts_with('/') && ::lstat(resolved.c_str(), &item) != 0) {
      const std::string fromHere = CanonicalItemPath(skip);
      if (::lstat(fromHere.c_str(), &item) == 0 && Within(fromHere, options.tree)) resolved = fromHere;
    }
    if (!Within(resolved, options.tree) || resolved == options.tree) {
      console.print("vtr-manifest: --skip " + EscapedText(skip) + " does not lie inside " + EscapedText(given));
      return kExitUsage;
    }
    skip = resolved;
  }
  return kExitOk;
}

WalkOutcome RunWalk(const WalkOptions& options, const VTRManifest::Handler& handler, Console& console) {
  WalkOutcome outcome;
  VTRManifest manifest;
  manifest.setKeyRule(VTRManifest::KeyRule::kExactPrefix);
  manifest.setOmissionHandler(
      [&outcome](const std::string& path, const Error& error) { outcome.omitted.emplace_back(path, error); });
  if (options.jobs) manifest.setRecordThreads(*options.jobs);
  VTRProgressUpdater updater;
  if (console.drawsProgress()) {
    updater.setSender([&console](int64_t percent) { console.showProgress(percent); });
    manifest.setProgressUpdater(&updater);
  }
  // The builder records a regular file whose content it cannot read with an
  // empty digest (the helper's rule, for files without local content): a
  // tool names it instead of writing a record that no reading matches.
  const std::string base = options.relativeTo.value_or(options.tree);
  const VTRManifest::Handler described = [&](const VTRFileMetadata& record, const std::string& key) {
    const std::string* type = record.getFileType();
    const Bytes* digest = record.getHash();
    if (type != nullptr && *type == kNSFileTypeRegular && digest != nullptr && digest->empty()) {
      outcome.omitted.emplace_back(base == "/" ? key : base + key, Error(0, "its content cannot be read"));
      return true;
    }
    return handler(record, key);
  };
  outcome.filled =
      manifest.enumerateAndCollectMetaData(options.tree, base, options.skip, options.inclusive, described);
  console.finish();
  return outcome;
}

int ReportWalkOutcome(const WalkOutcome& outcome, Console& console) {
  bool unreadable = false;
  for (const auto& [path, error] : outcome.omitted) {
    if (error.code() == EILSEQ) {
      console.print("vtr-manifest: cannot record " + EscapedText(path) +
                    ": a name in it, its link target or an extended attribute's name is not UTF-8 text, which a "
                    "manifest cannot hold");
    } else {
      unreadable = true;
      const std::string why = error.code() != 0 ? std::strerror(error.code()) : error.message();
      console.print("vtr-manifest: cannot read " + EscapedText(path) + ": " + why);
    }
  }
  if (!outcome.filled) {
    console.print("vtr-manifest: the tree could not be walked to its end");
    return kExitIoError;
  }
  if (outcome.omitted.empty()) return kExitOk;
  return unreadable ? kExitIoError : kExitBadInput;
}

}  // namespace vtr::manifest_tool
