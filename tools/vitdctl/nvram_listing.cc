#include "tools/vitdctl/nvram_listing.h"

#include <fcntl.h>

#include <nlohmann/json.hpp>

#include "platform/base64.h"
#include "platform/device_properties.h"
#include "platform/format.h"
#include "platform/nvram_store.h"
#include "platform/unique_fd.h"
#include "platform/utf8.h"
#include "tools/vitdctl/session.h"

namespace vtr::vitdctl {
namespace {

std::string Hex(const std::vector<uint8_t>& bytes) {
  static const char kDigits[] = "0123456789abcdef";
  std::string text;
  for (uint8_t b : bytes) {
    text += kDigits[b >> 4];
    text += kDigits[b & 15];
  }
  return text;
}

}  // namespace

int ListNvram(const std::string& root, bool json, FILE* out) {
  UniqueFd rootFd(::open(root.empty() ? "/" : root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  Result<NvramStore> store = rootFd ? NvramStore::Open(rootFd.get(), kEfiVariablesFolder)
                                    : Result<NvramStore>(Error::FromErrno(root));
  Result<std::vector<NvramStore::Variable>> variables =
      store.ok() ? store->list() : Result<std::vector<NvramStore::Variable>>(store.error());
  if (!variables.ok()) {
    std::fprintf(stderr, "vitdctl: cannot read the firmware variables in %s%s: %s\n", root.c_str(),
                 kEfiVariablesFolder, variables.error().description().c_str());
    return kExitNoInput;
  }
  if (json) {
    nlohmann::json list = nlohmann::json::array();
    for (const NvramStore::Variable& v : *variables) {
      const std::string_view text(reinterpret_cast<const char*>(v.value.data()), v.value.size());
      std::string base64;
      AppendBase64(v.value, &base64);
      list.push_back({{"name", v.name},
                      {"attributes", v.attributes},
                      {"value", IsValidUtf8(text) ? nlohmann::json(std::string(text)) : nlohmann::json(nullptr)},
                      {"base64", base64}});
    }
    std::fprintf(out, "%s\n", list.dump(2).c_str());
    return 0;
  }
  for (const NvramStore::Variable& v : *variables) {
    const std::string text(v.value.begin(), v.value.end());
    const std::string shown = IsValidUtf8(text) ? FormatEscaped("\"%@\"", text) : "hex:" + Hex(v.value);
    std::fprintf(out, "%s = %s\n", v.name.c_str(), shown.c_str());
  }
  return 0;
}

}  // namespace vtr::vitdctl
