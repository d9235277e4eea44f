#include "model/file_hash.h"

#include <fcntl.h>
#include <openssl/evp.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <memory>

#include "model/log.h"
#include "platform/item_io.h"
#include "platform/termination.h"
#include "platform/unique_fd.h"

namespace vtr {
namespace {

struct DigestContextFree {
  void operator()(EVP_MD_CTX* context) const { EVP_MD_CTX_free(context); }
};

// Fetched once: passing EVP_sha1() to every init would look the
// implementation up again for each file. Kept for the life of the process.
const EVP_MD* Sha1() {
  static EVP_MD* const sha1 = EVP_MD_fetch(nullptr, "SHA1", nullptr);
  return sha1;
}

// The per-thread read buffer and digest context: a manifest hashes every
// file of a device, and neither needs to be made anew for each.
struct HashScratch {
  std::unique_ptr<uint8_t[]> chunk{new uint8_t[kFileHashChunkBytes]};
  std::unique_ptr<EVP_MD_CTX, DigestContextFree> context{EVP_MD_CTX_new()};
};

HashScratch& Scratch() {
  thread_local HashScratch scratch;
  return scratch;
}

// Feeds the first size bytes of the file (its size when it was opened: a
// file that grows while it is read is never read past that) to the digest;
// false on a read error, and when the helper is asked to terminate.
bool DigestFile(int fd, off_t size, EVP_MD_CTX* context, uint8_t* chunk, PageCache cache) {
  if (context == nullptr || EVP_DigestInit_ex(context, Sha1(), nullptr) != 1) return false;
  return ReadOnce(fd, static_cast<uint64_t>(size), std::span<uint8_t>(chunk, kFileHashChunkBytes),
                  [context](std::span<const uint8_t> piece) {
                    return !TerminationRequested() && EVP_DigestUpdate(context, piece.data(), piece.size()) == 1;
                  },
                  cache);
}

}  // namespace

std::optional<Bytes> fileHash(const std::string& path) { return fileHashAt(AT_FDCWD, path, path); }

std::optional<Bytes> fileHashAt(int dirFd, const std::string& name, const std::string& path) {
  return fileHashOfDescriptor(OpenFileForHashAt(dirFd, name).get(), path);
}

UniqueFd OpenFileForHashAt(int dirFd, const std::string& name) { return OpenForReadingQuietly(dirFd, name); }

std::optional<Bytes> fileHashOfDescriptor(int fd, const std::string& path, PageCache cache) {
  struct stat st;
  if (fd < 0 || !StatOf(fd, &st) || !S_ISREG(st.st_mode)) {
    VTRLogError("Cannot read file %@", path);
    return std::nullopt;
  }
  HashScratch& scratch = Scratch();
  Bytes digest(kFileHashDigestBytes);
  unsigned int length = 0;
  if (!DigestFile(fd, st.st_size, scratch.context.get(), scratch.chunk.get(), cache) ||
      EVP_DigestFinal_ex(scratch.context.get(), digest.data(), &length) != 1 || length != digest.size()) {
    VTRLogError("Cannot read data from %@.", path);
    return std::nullopt;
  }
  return digest;
}

std::optional<Bytes> copyHashing(int from, uint64_t size, int to) {
  HashScratch& scratch = Scratch();
  EVP_MD_CTX* context = scratch.context.get();
  if (context == nullptr || EVP_DigestInit_ex(context, Sha1(), nullptr) != 1) return std::nullopt;
  uint64_t written = 0;
  const bool copied = ReadOnce(from, size, std::span<uint8_t>(scratch.chunk.get(), kFileHashChunkBytes),
                               [&](std::span<const uint8_t> piece) {
                                 if (TerminationRequested() ||
                                     !WriteAllAt(to, piece, written) ||
                                     EVP_DigestUpdate(context, piece.data(), piece.size()) != 1) {
                                   return false;
                                 }
                                 written += piece.size();
                                 return true;
                               },
                               PageCache::kKeep);
  Bytes digest(kFileHashDigestBytes);
  unsigned int length = 0;
  if (!copied || EVP_DigestFinal_ex(context, digest.data(), &length) != 1 || length != digest.size()) {
    return std::nullopt;
  }
  return digest;
}

std::optional<Bytes> directoryHash(const std::string&) { return std::nullopt; }

}  // namespace vtr
