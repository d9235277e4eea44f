// Reads arbitrary bytes as an XML property list. Whatever is read must be
// writable again, and writing is a fixed point: the written text reads back
// to a value that writes the very same text (the text tells every type and
// value apart, NaN included, where Value equality would not).
#include <cstdint>
#include <cstdlib>
#include <cstdio>
#include <span>
#include <string>

#include "platform/plist.h"

namespace {

void Check(bool condition, const char* what) {
  if (!condition) {
    std::fprintf(stderr, "xml_plist fuzz: %s\n", what);
    std::abort();
  }
}

std::span<const uint8_t> AsBytes(const std::string& text) {
  return std::span(reinterpret_cast<const uint8_t*>(text.data()), text.size());
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  vtr::PlistLimits limits;
  limits.maxInputBytes = 1 << 20;
  vtr::Result<vtr::Value> value = vtr::ReadXmlPropertyList(std::span(data, size), limits);
  if (!value.ok()) return 0;

  vtr::Result<std::string> xml = vtr::EncodeXmlPropertyList(*value);
  Check(xml.ok(), "a value that was read cannot be written");
  vtr::Result<vtr::Value> back = vtr::ReadXmlPropertyList(AsBytes(*xml));
  Check(back.ok(), "written XML does not read back");
  vtr::Result<std::string> again = vtr::EncodeXmlPropertyList(*back);
  Check(again.ok() && *again == *xml, "writing what was read back gives other text");
  Check(xml->find("nan</real>") != std::string::npos || *back == *value, "value changed through XML");
  return 0;
}
