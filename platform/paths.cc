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

std::string LastPathComponent(std::string_view path) {
  while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
  if (path == "/") return "/";
  const size_t slash = path.rfind('/');
  return std::string(slash == std::string_view::npos ? path : path.substr(slash + 1));
}

}  // namespace vtr
