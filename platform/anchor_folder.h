// Reading the trust anchors of one folder as an attacker may have laid them
// out: only what root (or whoever verifies) put there, closed to everyone
// else, counts. A compromised client can plant links, files it owns or files
// anyone may write; none of them may become a trusted root.
#ifndef VTR_PLATFORM_ANCHOR_FOLDER_H_
#define VTR_PLATFORM_ANCHOR_FOLDER_H_

#include <fcntl.h>

#include <string>
#include <vector>

#include "platform/result.h"

namespace vtr {

// The largest anchor file read: a handful of PEM certificates.
inline constexpr size_t kMaxAnchorFileBytes = 1 << 20;

struct AnchorFile {
  std::string path;   // the folder's path and the entry's name, for messages
  std::string bytes;  // the file's content, read from the descriptor checked
};

struct AnchorFolder {
  std::vector<AnchorFile> files;
  // One line per *.pem entry that does not count, naming it and why.
  std::vector<std::string> passedOver;
};

// The *.pem entries of folder (an absolute path, resolved beneath rootFd;
// AT_FDCWD: from "/"), in name order. The folder is reached without following
// a link at any component and must be owned by root or the effective user
// and not writable by group or others; otherwise an Error (EPERM) saying
// why. Each entry is opened relative to the folder without following a link
// and counts only if the opened file is a regular file with that owner, not
// writable by group or others, of at most kMaxAnchorFileBytes; the rest is
// read from that descriptor. Other names are not anchors and are ignored.
Result<AnchorFolder> ReadAnchorFolder(const std::string& folder, int rootFd = AT_FDCWD);

}  // namespace vtr

#endif  // VTR_PLATFORM_ANCHOR_FOLDER_H_
