// Feeds arbitrary bytes to the binary property-list reader. Besides never
// crashing, hanging or allocating without bound, whatever it accepts must
// survive a round trip: written out and read back, it gives the same bytes
// again. Only a value holding a null object may be refused by the writer.
// The document reader that decodes on demand must agree with it: it opens
// whatever the reader accepts and gives the same value, and what it refuses
// the reader refuses too.
#include <cstdint>
#include <cstdlib>
#include <vector>

#include "platform/plist.h"
#include "platform/plist_document.h"

namespace {

bool ContainsNil(const vtr::Value& value) {
  std::vector<const vtr::Value*> pending{&value};
  while (!pending.empty()) {
    const vtr::Value* v = pending.back();
    pending.pop_back();
    if (v->isNil()) return true;
    if (const vtr::Array* array = v->array()) {
      for (const vtr::Value& item : *array) pending.push_back(&item);
    } else if (const vtr::Dictionary* dict = v->dictionary()) {
      for (const auto& entry : *dict) pending.push_back(&entry.second);
    }
  }
  return false;
}

// Equal as written out, bit for bit (a NaN equals itself); values holding
// a null object cannot be written and are compared as text.
bool Same(const vtr::Value& a, const vtr::Value& b) {
  vtr::Result<vtr::Bytes> x = vtr::EncodeBinaryPropertyList(a);
  vtr::Result<vtr::Bytes> y = vtr::EncodeBinaryPropertyList(b);
  if (x.ok() && y.ok()) return *x == *y;
  return x.ok() == y.ok() && a.description() == b.description();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  vtr::PlistLimits limits;
  // Small enough bounds to keep each run fast; the bounding itself is what
  // is exercised.
  limits.maxExpandedNodes = 1 << 16;
  limits.maxExpandedBytes = 1 << 22;
  vtr::Result<vtr::Value> value = vtr::ReadBinaryPropertyList({data, size}, limits);
  vtr::Result<std::unique_ptr<vtr::PlistDocument>> document = vtr::PlistDocument::Open({data, size}, limits);
  if (!document.ok() && value.ok()) std::abort();
  if (document.ok() && value.ok()) {
    vtr::Result<vtr::Value> lazy = (*document)->top().value();
    if (!lazy.ok() || !Same(*lazy, *value)) std::abort();
  }
  if (!value.ok()) return 0;
  vtr::Result<vtr::Bytes> first = vtr::EncodeBinaryPropertyList(*value);
  if (!first.ok()) {
    if (!ContainsNil(*value)) std::abort();
    return 0;
  }
  vtr::Result<vtr::Value> again = vtr::ReadBinaryPropertyList(*first, limits);
  if (!again.ok()) std::abort();
  vtr::Result<vtr::Bytes> second = vtr::EncodeBinaryPropertyList(*again);
  if (!second.ok() || *second != *first) std::abort();
  return 0;
}
