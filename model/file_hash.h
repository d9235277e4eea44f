// Content hashes of file-system items, as metadata records store them: the
// SHA-1 digest of a regular file's bytes. Directories carry no hash.
//
// Reading is sequential in chunks of kFileHashChunkBytes through one buffer
// per thread, so memory does not grow with the file; the pages read are
// dropped from the page cache behind the reader (a manifest of a whole
// device would otherwise push everything else out of the cache).
//
// Both functions may be called from several threads at once.
#ifndef VTR_MODEL_FILE_HASH_H_
#define VTR_MODEL_FILE_HASH_H_

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

#include "platform/item_io.h"
#include "platform/unique_fd.h"
#include "platform/value.h"

namespace vtr {

inline constexpr size_t kFileHashChunkBytes = 262144;
inline constexpr size_t kFileHashDigestBytes = 20;

// The 20-byte SHA-1 digest of the regular file at path (of no bytes for an
// empty file), or nullopt on failure. The helper runs as root and hashes
// whatever a client names, so only a regular file is read: a symbolic link at
// the last component is not followed, and a fifo or device is refused after
// a non-blocking open (it could hang the helper or have effects on open).
// The file's access time is left as it was wherever the caller may ask for
// that (its owner, or root). A file that cannot be opened, or is not a
// regular file, logs "Cannot read file %@"; a read error logs "Cannot read
// data from %@.".
std::optional<Bytes> fileHash(const std::string& path);

// fileHash of the entry name of the open directory dirFd, looked up in that
// directory alone; path names the file in the messages. dirFd stays the
// caller's.
std::optional<Bytes> fileHashAt(int dirFd, const std::string& name, const std::string& path);

// Opens the entry name of dirFd for hashing as fileHash does (read-only,
// never through a symbolic link, non-blocking, access time kept where
// allowed); invalid with errno set when it cannot be opened. The descriptor
// may serve other reads of the same item (extended attributes) first.
UniqueFd OpenFileForHashAt(int dirFd, const std::string& name);

// The digest of the file open as fd, read from its start whatever its
// offset; fd stays the caller's. An invalid fd (the file could not be opened)
// or one that is not a regular file logs "Cannot read file %@" (path), a
// read error "Cannot read data from %@.".
// With PageCache::kKeep the pages read stay cached (a restore's files are
// about to be used).
std::optional<Bytes> fileHashOfDescriptor(int fd, const std::string& path,
                                          PageCache cache = PageCache::kDropBehind);

// Copies the first size bytes of the file open as from (fewer when it ends
// first) to the start of the file open as to, and answers the digest of the
// bytes written, hashed as they are written: when no other process can
// reach `to`, the digest is that of its content. nullopt, errno set, on a
// read or write error and when the helper is asked to terminate. Reads as
// fileHashOfDescriptor does, the pages kept; logs nothing.
std::optional<Bytes> copyHashing(int from, uint64_t size, int to);

// Directories carry no hash: always nullopt, without touching the disk.
std::optional<Bytes> directoryHash(const std::string& path);

}  // namespace vtr

#endif  // VTR_MODEL_FILE_HASH_H_
