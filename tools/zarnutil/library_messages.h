// The volume-manager library writes its diagnostics ("zarn: ...") straight to
// standard error. zarnutil keeps the few that tell a user something and puts
// the rest (a repair prints a line for each of up to 1,023 chunks) into a
// summary of its own; this collects them while a library call runs.
#ifndef VTR_TOOLS_ZARNUTIL_LIBRARY_MESSAGES_H_
#define VTR_TOOLS_ZARNUTIL_LIBRARY_MESSAGES_H_

#include <string>
#include <vector>

#include "platform/unique_fd.h"

namespace vtr {

// From construction to finish() (or destruction), what the process writes to
// file descriptor 2 goes to a memory file instead. When the redirection
// cannot be set up, messages go to standard error as before and finish()
// answers nothing. Not for use from several threads.
class LibraryMessages {
 public:
  LibraryMessages();
  ~LibraryMessages();
  LibraryMessages(const LibraryMessages&) = delete;
  LibraryMessages& operator=(const LibraryMessages&) = delete;

  // Restores standard error and answers the lines written meanwhile, each
  // without its "zarn: " prefix and newline. Later calls answer nothing.
  std::vector<std::string> finish();

 private:
  UniqueFd saved_;     // the real standard error
  UniqueFd captured_;  // where it went meanwhile
};

// Writes lines back to standard error as the library wrote them.
void ReplayLibraryMessages(const std::vector<std::string>& lines);

}  // namespace vtr

#endif  // VTR_TOOLS_ZARNUTIL_LIBRARY_MESSAGES_H_
