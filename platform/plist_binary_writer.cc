// Writing binary property lists: a whole Value at once, or a top dictionary
// streamed entry by entry.
#include <openssl/evp.h>

#include <algorithm>
#include <bit>
#include <cstring>
#include <memory>
#include <vector>

#include "platform/plist.h"
#include "platform/plist_binary_encoder.h"

namespace vtr {
namespace {

using bplist::ObjectEncoder;

// An upper bound of the objects value is written as: every value and every
// dictionary key, before repeated ones are shared.
uint64_t CountObjects(const Value& value) {
  uint64_t count = 0;
  std::vector<const Value*> pending{&value};
  while (!pending.empty()) {
    const Value* v = pending.back();
    pending.pop_back();
    ++count;
    if (const Array* array = v->array()) {
      for (const Value& item : *array) pending.push_back(&item);
    } else if (const Dictionary* dict = v->dictionary()) {
      count += dict->size();
      for (const auto& entry : *dict) pending.push_back(&entry.second);
    }
  }
  return count;
}

}  // namespace

Result<Bytes> EncodeBinaryPropertyList(const Value& value) {
  MemoryOutputStream out;
  const uint64_t objects = CountObjects(value);
  // A small value needs no large memory of repeated objects.
  const size_t cacheCapacity = std::bit_ceil(std::min<uint64_t>(objects, bplist::ObjectCache::kDefaultCapacity));
  ObjectEncoder encoder(&out, bplist::BytesNeeded(objects - 1), cacheCapacity);
  if (Status s = encoder.begin(); !s.ok()) return s.error();
  Result<uint64_t> top = encoder.write(value);
  if (!top.ok()) return top.error();
  if (Status s = encoder.end(*top); !s.ok()) return s.error();
  return out.take();
}

// The streaming writer does not know how many objects will come, so it
// always writes 4-byte references (up to 2^32 objects). To replace the value
// of a key added again without keeping every key in memory, it remembers a
// 128-bit SHA-256 prefix of each key: equal prefixes of different keys are
// out of reach even for chosen keys, and each entry costs a few dozen bytes.
class BinaryPlistDictionaryWriter::Impl {
 public:
  explicit Impl(OutputStream* out) : encoder_(out, 4) {}

  Status add(std::string_view key, const Value& value) {
    if (Status s = start(); !s.ok()) return s;
    Result<Digest> digest = digestOf(key);
    if (!digest.ok()) return digest.error();
    uint32_t* slot = find(*digest);
    if (*slot != 0) {
      Result<uint64_t> valueIndex = encoder_.write(value);
      if (!valueIndex.ok()) return valueIndex.error();
      entries_[*slot - 1].value = static_cast<uint32_t>(*valueIndex);
      return Status::Ok();
    }
    Result<uint64_t> keyIndex = encoder_.writeString(key);
    if (!keyIndex.ok()) return keyIndex.error();
    Result<uint64_t> valueIndex = encoder_.write(value);
    if (!valueIndex.ok()) return valueIndex.error();
    entries_.push_back({static_cast<uint32_t>(*keyIndex), static_cast<uint32_t>(*valueIndex), *digest});
    *slot = static_cast<uint32_t>(entries_.size());
    if (2 * entries_.size() > table_.size()) grow();
    return Status::Ok();
  }

  Status finish() {
    if (Status s = start(); !s.ok()) return s;
    finished_ = true;
    Result<uint64_t> top = encoder_.writeDictionary(
        entries_.size(), [this](uint64_t i) { return entries_[i].key; },
        [this](uint64_t i) { return entries_[i].value; });
    if (!top.ok()) return top.error();
    return encoder_.end(*top);
  }

 private:
  struct Digest {
    uint8_t bytes[16];
    uint64_t hash() const {
      uint64_t h;
      std::memcpy(&h, bytes, sizeof h);
      return h;
    }
    bool operator==(const Digest& other) const { return std::memcmp(bytes, other.bytes, sizeof bytes) == 0; }
  };
  struct Entry {
    uint32_t key;
    uint32_t value;
    Digest digest;
  };
  struct MdDeleter {
    void operator()(EVP_MD* md) const { EVP_MD_free(md); }
  };
  struct MdContextDeleter {
    void operator()(EVP_MD_CTX* ctx) const { EVP_MD_CTX_free(ctx); }
  };

  Status start() {
    if (finished_) return Error::Invalid("binary property list: the writer is finished");
    if (started_) return Status::Ok();
    started_ = true;
    return encoder_.begin();
  }

  Result<Digest> digestOf(std::string_view key) {
    if (!sha256_) {
      sha256_.reset(EVP_MD_fetch(nullptr, "SHA256", nullptr));
      context_.reset(EVP_MD_CTX_new());
    }
    uint8_t full[EVP_MAX_MD_SIZE];
    unsigned int length = 0;
    if (!sha256_ || !context_ || EVP_DigestInit_ex2(context_.get(), sha256_.get(), nullptr) != 1 ||
        EVP_DigestUpdate(context_.get(), key.data(), key.size()) != 1 ||
        EVP_DigestFinal_ex(context_.get(), full, &length) != 1) {
      return Error::Invalid("binary property list: SHA-256 is not available");
    }
    Digest digest;
    std::memcpy(digest.bytes, full, sizeof digest.bytes);
    return digest;
  }

  // The table slot holding the entry with this digest, or the empty slot
  // where it would go.
  uint32_t* find(const Digest& digest) {
    const size_t mask = table_.size() - 1;
    for (size_t i = digest.hash() & mask;; i = (i + 1) & mask) {
      if (table_[i] == 0 || entries_[table_[i] - 1].digest == digest) return &table_[i];
    }
  }

  void grow() {
    table_.assign(2 * table_.size(), 0);
    for (size_t e = 0; e < entries_.size(); ++e) *find(entries_[e].digest) = static_cast<uint32_t>(e + 1);
  }

  ObjectEncoder encoder_;
  bool started_ = false;
  bool finished_ = false;
  std::vector<Entry> entries_;
  // Open addressing over entries_: 1 + the entry's position, 0 when empty.
  std::vector<uint32_t> table_ = std::vector<uint32_t>(1024, 0);
  std::unique_ptr<EVP_MD, MdDeleter> sha256_;
  std::unique_ptr<EVP_MD_CTX, MdContextDeleter> context_;
};

BinaryPlistDictionaryWriter::BinaryPlistDictionaryWriter(OutputStream* out) : impl_(new Impl(out)) {}
BinaryPlistDictionaryWriter::~BinaryPlistDictionaryWriter() { delete impl_; }

Status BinaryPlistDictionaryWriter::add(std::string_view key, const Value& value) { return impl_->add(key, value); }
Status BinaryPlistDictionaryWriter::finish() { return impl_->finish(); }

}  // namespace vtr
