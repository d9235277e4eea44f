#include "platform/paths.h"

namespace vtr {

std::string AppendPathComponent(std::string_view base, std::string_view component) {
  while (base.size() > 1 && base.back() == '/') base.remove_suffix(1);
  while (!component.empty() && component.front() == '/') component.remove_prefix(1);
  while (!component.empty() && component.back() == '/') component.remove_suffix(1);
  std::string out(base);
  if (component.empty()) return out;
  if (!out.empty() && out.back() != '/') out += '/';
  out += component;
  return out;
}

PathParts SplitLastComponent(std::string_view path) {
  const size_t slash = path.rfind('/');
  if (slash == std::string_view::npos) return {".", std::string(path)};
  return {slash == 0 ? "/" : std::string(path.substr(0, slash)), std::string(path.substr(slash + 1))};
}

}  // namespace vtr
