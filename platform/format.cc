#include "platform/format.h"

#include <algorithm>
#include <cstdio>

namespace vtr {
namespace format_detail {
namespace {

// printf of one value with the specification text (everything from '%' to
// the conversion, with the length modifier replaced by the caller's own).
template <typename T>
void AppendPrintf(std::string& out, const std::string& spec, T value) {
  char small[128];
  const int n = std::snprintf(small, sizeof small, spec.c_str(), value);
  if (n < 0) return;
  if (static_cast<size_t>(n) < sizeof small) {
    out.append(small, static_cast<size_t>(n));
    return;
  }
  std::string big(static_cast<size_t>(n) + 1, '\0');
  std::snprintf(big.data(), big.size(), spec.c_str(), value);
  out.append(big.data(), static_cast<size_t>(n));
}

// The specification without its length modifier, with `length` put back in.
std::string SpecWith(std::string_view fmt, const Spec& spec, std::string_view length) {
  std::string_view body = fmt.substr(spec.begin, spec.end - 1 - spec.begin);
  while (!body.empty() && (body.back() == 'l' || body.back() == 'h' || body.back() == 'z')) body.remove_suffix(1);
  std::string s(body);
  s += length;
  s += spec.conversion;
  return s;
}

void AppendInteger(std::string& out, std::string_view fmt, const Spec& spec, const Arg& a) {
  const int64_t sv = a.kind == Arg::kSigned ? a.i : static_cast<int64_t>(a.u);
  const uint64_t uv = a.kind == Arg::kSigned ? static_cast<uint64_t>(a.i) : a.u;
  const bool is_signed = spec.conversion == 'd' || spec.conversion == 'i';
  switch (spec.length) {
    case 'l':
    case 'L':
    case 'z':
      if (is_signed) {
        AppendPrintf(out, SpecWith(fmt, spec, "ll"), static_cast<long long>(sv));
      } else {
        AppendPrintf(out, SpecWith(fmt, spec, "ll"), static_cast<unsigned long long>(uv));
      }
      break;
    case 'h':
      if (is_signed) {
        AppendPrintf(out, SpecWith(fmt, spec, ""), static_cast<int>(static_cast<short>(sv)));
      } else {
        AppendPrintf(out, SpecWith(fmt, spec, ""), static_cast<unsigned>(static_cast<unsigned short>(uv)));
      }
      break;
    default:
      if (spec.conversion == 'c') {
        AppendPrintf(out, SpecWith(fmt, spec, ""), static_cast<int>(static_cast<unsigned char>(uv)));
      } else if (is_signed) {
        AppendPrintf(out, SpecWith(fmt, spec, ""), static_cast<int>(sv));
      } else {
        AppendPrintf(out, SpecWith(fmt, spec, ""), static_cast<unsigned>(uv));
      }
  }
}

}  // namespace

std::string FormatArgs(std::string_view fmt, Arg* args, size_t count) {
  std::string out;
  out.reserve(fmt.size() + 32);
  size_t next = 0;
  for (size_t i = 0; i < fmt.size(); ++i) {
    if (fmt[i] != '%') {
      out += fmt[i];
      continue;
    }
    Spec spec;
    if (!ParseSpec(fmt, i, &spec)) {  // checked at compile time; kept literal
      out += fmt[i];
      continue;
    }
    i = spec.end - 1;
    if (spec.conversion == '%') {
      out += '%';
      continue;
    }
    if (next >= count) break;  // cannot happen after the compile-time check
    Arg& a = args[next++];
    switch (spec.conversion) {
      case 's':
      case '@':
        if (a.kind == Arg::kNull) {
          out += "(null)";
        } else if (a.owned.empty() && spec.begin + 2 == spec.end) {
          out += a.text;
        } else {
          const std::string text = a.owned.empty() ? std::string(a.text) : a.owned;
          if (spec.conversion == '@' || spec.begin + 2 == spec.end) {
            out += text;
          } else {
            AppendPrintf(out, SpecWith(fmt, spec, ""), text.c_str());
          }
        }
        break;
      case 'f':
      case 'e':
      case 'g':
        AppendPrintf(out, SpecWith(fmt, spec, ""), a.d);
        break;
      default:
        AppendInteger(out, fmt, spec, a);
    }
  }
  return out;
}

}  // namespace format_detail

std::string EscapeControlCharacters(std::string_view text) {
  static constexpr char kHex[] = "0123456789abcdef";
  std::string out;
  out.reserve(text.size());
  for (const char c : text) {
    const auto u = static_cast<unsigned char>(c);
    if (u >= 0x20 && u != 0x7f) {
      out += c;
    } else if (c == '\n') {
      out += "\\n";
    } else if (c == '\t') {
      out += "\\t";
    } else if (c == '\r') {
      out += "\\r";
    } else {
      out += "\\x";
      out += kHex[u >> 4];
      out += kHex[u & 15];
    }
  }
  return out;
}

namespace format_detail {

void EscapeControlCharacters(Arg* arg) {
  if (arg->kind != Arg::kText) return;
  // An object's description is in owned, a string's text in text.
  const std::string_view text = arg->owned.empty() ? arg->text : std::string_view(arg->owned);
  const bool clean = std::all_of(text.begin(), text.end(), [](char c) {
    const auto u = static_cast<unsigned char>(c);
    return u >= 0x20 && u != 0x7f;
  });
  if (clean) return;
  arg->owned = vtr::EscapeControlCharacters(text);
}

}  // namespace format_detail
}  // namespace vtr
