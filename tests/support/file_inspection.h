// Looking at file-system items in tests: their status and extended
// attributes, read without following a symbolic link.
#ifndef VTR_TESTS_SUPPORT_FILE_INSPECTION_H_
#define VTR_TESTS_SUPPORT_FILE_INSPECTION_H_

#include <sys/stat.h>
#include <sys/xattr.h>

#include <string>

#include <gtest/gtest.h>

namespace vtr::testing {

// lstat of path; a failure fails the test (and answers zeros).
inline struct stat Lstat(const std::string& path) {
  struct stat st {};
  EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
  return st;
}

// Whether something (a dangling link included) stands at path.
inline bool Exists(const std::string& path) {
  struct stat st;
  return ::lstat(path.c_str(), &st) == 0;
}

// Whether a directory (not a link to one) stands at path.
inline bool IsDirectory(const std::string& path) {
  struct stat st;
  return ::lstat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

// The value of the extended attribute name of path itself, or "<none>".
inline std::string Xattr(const std::string& path, const char* name) {
  char value[256];
  const ssize_t n = ::lgetxattr(path.c_str(), name, value, sizeof value);
  return n < 0 ? "<none>" : std::string(value, static_cast<size_t>(n));
}

}  // namespace vtr::testing

#endif  // VTR_TESTS_SUPPORT_FILE_INSPECTION_H_
