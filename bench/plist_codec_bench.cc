// Streams a manifest-shaped dictionary through the binary property-list
// writer to a file, reads it back, and prints the time of each phase, the file
// size and the peak resident memory after each phase.
//
//   plist_codec_bench [ENTRIES [PATH]]   (default 300000 entries, a file in /tmp)
//
// Each entry is keyed by a path and holds what a file metadata record holds:
// a 15-key attribute dictionary, an extended-attribute dictionary, a 20-byte
// hash and a link target string. Peak memory after writing should not depend
// on ENTRIES beyond the writer's small per-entry index; compare two runs.
#include <fcntl.h>
#include <sys/resource.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <string>

#include "platform/output_stream.h"
#include "platform/plist.h"
#include "platform/unique_fd.h"

namespace vtr {
namespace {

// Wall-clock and CPU seconds since a starting point; CPU time stays
// meaningful when other work shares the machine.
struct Stopwatch {
  std::chrono::steady_clock::time_point wall = std::chrono::steady_clock::now();
  double cpu = CpuSeconds();

  static double CpuSeconds() {
    timespec ts{};
    clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &ts);
    return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) * 1e-9;
  }
  std::string elapsed() const {
    char text[64];
    std::snprintf(text, sizeof text, "%.3f s (CPU %.3f s)",
                  std::chrono::duration<double>(std::chrono::steady_clock::now() - wall).count(), CpuSeconds() - cpu);
    return text;
  }
};

long PeakRssKiB() {
  struct rusage usage {};
  getrusage(RUSAGE_SELF, &usage);
  return usage.ru_maxrss;
}

Value Entry(uint64_t i) {
  const bool odd = i % 2 == 1;
  Value attributes = Value::DictionaryOf({
      {"NSFileType", Value::String(odd ? "NSFileTypeRegular" : "NSFileTypeSymbolicLink")},
      {"NSFileSize", Value::Unsigned(4096 + i * 7)},
      {"NSFilePosixPermissions", Value::Integer(odd ? 0644 : 0755)},
      {"NSFileReferenceCount", Value::Integer(1)},
      {"NSFileOwnerAccountID", Value::Integer(501)},
      {"NSFileOwnerAccountName", Value::String("mobile")},
      {"NSFileGroupOwnerAccountID", Value::Integer(501)},
      {"NSFileGroupOwnerAccountName", Value::String("mobile")},
      {"NSFileModificationDate", Value::DateValue(Date{800000000.0 + static_cast<double>(i)})},
      {"NSFileCreationDate", Value::DateValue(Date{700000000.0 + static_cast<double>(i / 3)})},
      {"NSFileSystemNumber", Value::Integer(2049)},
      {"NSFileSystemFileNumber", Value::Integer(static_cast<int64_t>(1000000 + i))},
      {"NSFileImmutable", Value::Boolean(false)},
      {"NSFileAppendOnly", Value::Boolean(false)},
      {"NSFileExtensionHidden", Value::Boolean(false)},
  });
  Value xattrs = i % 10 == 0 ? Value::DictionaryOf({{"user.demo.tag", Value::Data("blue", 4)}})
                             : Value::DictionaryOf(Dictionary());
  uint8_t hash[20];
  for (int b = 0; b < 20; ++b) hash[b] = static_cast<uint8_t>((i * 2654435761u) >> (b % 8) ^ b);
  return Value::DictionaryOf({
      {"VTRManifestFileAttributes", attributes},
      {"VTRManifestFileExtendedAttributes", xattrs},
      {"VTRManifestFileHash", Value::Data(hash, sizeof hash)},
      {"VTRManifestSymbolicLinkTargetFile", Value::String(odd ? "" : "../shared/target-" + std::to_string(i % 97))},
  });
}

std::string Key(uint64_t i) {
  return "/mobile/Library/Caches/com.orvane.demo/folder-" + std::to_string(i / 100) + "/file-" + std::to_string(i) +
         ".dat";
}

int Run(uint64_t entries, const std::string& path) {
  UniqueFd fd(open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644));
  if (!fd.valid()) {
    std::perror(path.c_str());
    return 1;
  }
  // The cost of making the values alone, to tell it from the writer's.
  const Stopwatch buildStart;
  uint64_t built = 0;
  for (uint64_t i = 0; i < entries; ++i) built += Key(i).size() + Entry(i).dictionary()->size();
  const std::string buildTime = buildStart.elapsed();
  if (built == 0) return 1;  // keeps the loop from being optimised away

  const Stopwatch writeStart;
  FdOutputStream out(fd.get());
  BinaryPlistDictionaryWriter writer(&out);
  for (uint64_t i = 0; i < entries; ++i) {
    if (Status s = writer.add(Key(i), Entry(i)); !s.ok()) {
      std::fprintf(stderr, "add: %s\n", s.error().description().c_str());
      return 1;
    }
  }
  if (Status s = writer.finish(); !s.ok()) {
    std::fprintf(stderr, "finish: %s\n", s.error().description().c_str());
    return 1;
  }
  const std::string writeTime = writeStart.elapsed();
  const uint64_t size = out.position();
  const long writeRss = PeakRssKiB();

  const Stopwatch readStart;
  Result<Value> back = ReadPropertyListFile(path);
  const std::string readTime = readStart.elapsed();
  if (!back.ok()) {
    std::fprintf(stderr, "read: %s\n", back.error().description().c_str());
    return 1;
  }
  const Dictionary* dict = back->dictionary();
  const bool same = dict && dict->size() == entries && back->get(Key(entries / 2)) == Entry(entries / 2);

  std::printf("entries            %llu\n", static_cast<unsigned long long>(entries));
  std::printf("file size          %.1f MB (%.0f bytes per entry)\n", static_cast<double>(size) / 1e6,
              static_cast<double>(size) / static_cast<double>(entries));
  std::printf("build values only  %s\n", buildTime.c_str());
  std::printf("write              %s, values built and streamed\n", writeTime.c_str());
  std::printf("peak RSS, written  %.1f MB\n", static_cast<double>(writeRss) / 1024);
  std::printf("read               %s\n", readTime.c_str());
  std::printf("peak RSS, read     %.1f MB\n", static_cast<double>(PeakRssKiB()) / 1024);
  std::printf("read back equal    %s\n", same ? "yes" : "NO");
  return same ? 0 : 1;
}

}  // namespace
}  // namespace vtr

int main(int argc, char** argv) {
  const uint64_t entries = argc > 1 ? std::strtoull(argv[1], nullptr, 10) : 300000;
  const std::string path = argc > 2 ? argv[2] : "/tmp/plist_codec_bench.plist";
  const int status = vtr::Run(entries, path);
  unlink(path.c_str());
  return status;
}
