// printf-style formatting with "%@" for objects, checked at compile time.
//
// Format(fmt, args...) accepts the conversions the system's messages use:
// %s %d %i %u %x %X %o %c %f %e %g %@ and %%, with flags (-+ 0#), a width, a
// precision and the length modifiers h, l, ll and z. The format must be a
// constant expression; each argument is checked against its conversion when
// the call is compiled, so a wrong type or count is a compile error, never
// undefined behaviour at run time:
//   %d %i        bool or an integer that fits in int (l/ll/z: in 64 bits)
//   %u           an unsigned integer of at most 32 bits (l/ll/z: 64 bits)
//   %x %X %o %c  an integer of at most 32 bits (l/ll/z: 64 bits)
//   %f %e %g     a floating-point number
//   %s           a C string, std::string or std::string_view; nullptr
//   %@           anything with a description(): Value, Date, Error, ...;
//                strings print bare; nullptr prints "(null)"
#ifndef VTR_PLATFORM_FORMAT_H_
#define VTR_PLATFORM_FORMAT_H_

#include <concepts>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <type_traits>

namespace vtr {
namespace format_detail {

// What the checker knows of an argument's type.
struct ArgTraits {
  enum Kind : uint8_t { kInteger, kBoolean, kFloating, kString, kObject, kNull, kUnsupported } kind;
  bool isSigned = false;
  int size = 0;
};

template <typename T>
concept Describable = requires(const T& t) {
  { t.description() } -> std::convertible_to<std::string>;
};

template <typename T>
consteval ArgTraits TraitsOf() {
  using U = std::remove_cvref_t<T>;
  if constexpr (std::is_same_v<U, bool>) {
    return {ArgTraits::kBoolean, false, 1};
  } else if constexpr (std::is_integral_v<U>) {
    return {ArgTraits::kInteger, std::is_signed_v<U>, static_cast<int>(sizeof(U))};
  } else if constexpr (std::is_floating_point_v<U>) {
    return {ArgTraits::kFloating, true, static_cast<int>(sizeof(U))};
  } else if constexpr (std::is_same_v<U, std::nullptr_t>) {
    return {ArgTraits::kNull};
  } else if constexpr (std::is_convertible_v<const U&, std::string_view>) {
    return {ArgTraits::kString};
  } else if constexpr (Describable<U>) {
    return {ArgTraits::kObject};
  } else {
    return {ArgTraits::kUnsupported};
  }
}

// Called only when a format does not fit its arguments; not being constexpr,
// a call reached during constant evaluation makes the compilation fail with
// this function's name in the diagnostic.
void format_string_does_not_match_its_arguments(const char* reason);

// One parsed conversion specification.
struct Spec {
  size_t begin = 0;   // index of '%'
  size_t end = 0;     // one past the conversion character
  char conversion = 0;
  int length = 0;     // 0 none, 'h', 'l', 'L' (ll), 'z'
};

// Parses the specification that starts at fmt[pos] == '%'. Returns false on
// a malformed one.
constexpr bool ParseSpec(std::string_view fmt, size_t pos, Spec* spec) {
  size_t i = pos + 1;
  while (i < fmt.size() && (fmt[i] == '-' || fmt[i] == '+' || fmt[i] == ' ' || fmt[i] == '0' || fmt[i] == '#')) ++i;
  while (i < fmt.size() && fmt[i] >= '0' && fmt[i] <= '9') ++i;
  if (i < fmt.size() && fmt[i] == '.') {
    ++i;
    while (i < fmt.size() && fmt[i] >= '0' && fmt[i] <= '9') ++i;
  }
  int length = 0;
  if (i < fmt.size() && fmt[i] == 'h') {
    length = 'h';
    ++i;
  } else if (i + 1 < fmt.size() && fmt[i] == 'l' && fmt[i + 1] == 'l') {
    length = 'L';
    i += 2;
  } else if (i < fmt.size() && (fmt[i] == 'l' || fmt[i] == 'z')) {
    length = fmt[i];
    ++i;
  }
  if (i >= fmt.size()) return false;
  const char c = fmt[i];
  constexpr std::string_view kConversions = "sdiuxXocfeg@%";
  if (kConversions.find(c) == std::string_view::npos) return false;
  const bool integer = std::string_view("diuxXoc").find(c) != std::string_view::npos;
  if (length != 0 && !integer) return false;
  *spec = Spec{pos, i + 1, c, length};
  return true;
}

constexpr bool Accepts(const Spec& spec, const ArgTraits& a) {
  const bool wide = spec.length == 'l' || spec.length == 'L' || spec.length == 'z';
  const bool integer = a.kind == ArgTraits::kInteger;
  switch (spec.conversion) {
    case 'd':
    case 'i':
      if (a.kind == ArgTraits::kBoolean) return true;
      if (!integer) return false;
      return wide ? (a.isSigned || a.size < 8) : (a.isSigned ? a.size <= 4 : a.size < 4);
    case 'u':
      return integer && !a.isSigned && a.size <= (wide ? 8 : 4);
    case 'x':
    case 'X':
    case 'o':
    case 'c':
      return integer && a.size <= (wide ? 8 : 4);
    case 'f':
    case 'e':
    case 'g':
      return a.kind == ArgTraits::kFloating;
    case 's':
      return a.kind == ArgTraits::kString || a.kind == ArgTraits::kNull;
    case '@':
      return a.kind == ArgTraits::kString || a.kind == ArgTraits::kObject || a.kind == ArgTraits::kNull;
    default:
      return false;
  }
}

template <typename... Args>
consteval void Check(std::string_view fmt) {
  constexpr ArgTraits traits[] = {TraitsOf<Args>()..., ArgTraits{ArgTraits::kUnsupported}};
  size_t arg = 0;
  for (size_t i = 0; i < fmt.size(); ++i) {
    if (fmt[i] != '%') continue;
    Spec spec;
    if (!ParseSpec(fmt, i, &spec)) format_string_does_not_match_its_arguments("malformed conversion");
    i = spec.end - 1;
    if (spec.conversion == '%') continue;
    if (arg >= sizeof...(Args)) format_string_does_not_match_its_arguments("too few arguments");
    if (traits[arg].kind == ArgTraits::kUnsupported) format_string_does_not_match_its_arguments("unsupported type");
    if (!Accepts(spec, traits[arg])) format_string_does_not_match_its_arguments("argument does not fit conversion");
    ++arg;
  }
  if (arg != sizeof...(Args)) format_string_does_not_match_its_arguments("too many arguments");
}

// An argument after type checking, as the run-time formatter sees it.
struct Arg {
  enum Kind : uint8_t { kSigned, kUnsigned, kFloating, kText, kNull } kind = kNull;
  int64_t i = 0;
  uint64_t u = 0;
  double d = 0;
  std::string_view text;
  std::string owned;  // holds a description() while formatting
};

template <typename T>
Arg MakeArg(const T& v) {
  using U = std::remove_cvref_t<T>;
  Arg a;
  if constexpr (std::is_same_v<U, bool>) {
    a.kind = Arg::kSigned;
    a.i = v ? 1 : 0;
  } else if constexpr (std::is_integral_v<U> && std::is_signed_v<U>) {
    a.kind = Arg::kSigned;
    a.i = v;
  } else if constexpr (std::is_integral_v<U>) {
    a.kind = Arg::kUnsigned;
    a.u = v;
  } else if constexpr (std::is_floating_point_v<U>) {
    a.kind = Arg::kFloating;
    a.d = static_cast<double>(v);
  } else if constexpr (std::is_same_v<U, std::nullptr_t>) {
    a.kind = Arg::kNull;
  } else if constexpr (std::is_convertible_v<const U&, std::string_view>) {
    a.kind = Arg::kText;
    if constexpr (std::is_pointer_v<U>) {
      if (v == nullptr) {
        a.kind = Arg::kNull;
        return a;
      }
    }
    a.text = std::string_view(v);
  } else {
    a.kind = Arg::kText;
    a.owned = v.description();
  }
  return a;
}

std::string FormatArgs(std::string_view fmt, Arg* args, size_t count);

// Replaces a text argument by its text with control characters escaped.
void EscapeControlCharacters(Arg* arg);

}  // namespace format_detail

// A format string checked against the argument types Args at compile time.
template <typename... Args>
class FormatString {
 public:
  template <typename S>
    requires std::convertible_to<const S&, std::string_view>
  consteval FormatString(const S& text) : text_(text) {  // NOLINT: implicit on purpose
    format_detail::Check<Args...>(text_);
  }
  std::string_view text() const { return text_; }

 private:
  std::string_view text_;
};

// The message made of fmt and args; see the conversions above.
template <typename... Args>
std::string Format(FormatString<std::type_identity_t<Args>...> fmt, const Args&... args) {
  format_detail::Arg converted[] = {format_detail::MakeArg(args)..., format_detail::Arg()};
  return format_detail::FormatArgs(fmt.text(), converted, sizeof...(Args));
}

// Format, with the control characters in the text of every argument (a
// string, or the description of an object) escaped as \n, \t, \r or \xNN:
// what the logs write, so that no value can start a line of its own.
template <typename... Args>
std::string FormatEscaped(FormatString<std::type_identity_t<Args>...> fmt, const Args&... args) {
  format_detail::Arg converted[] = {format_detail::MakeArg(args)..., format_detail::Arg()};
  for (format_detail::Arg& arg : converted) format_detail::EscapeControlCharacters(&arg);
  return format_detail::FormatArgs(fmt.text(), converted, sizeof...(Args));
}

// text with its control characters (below 0x20, and 0x7f) escaped as above.
std::string EscapeControlCharacters(std::string_view text);

}  // namespace vtr

#endif  // VTR_PLATFORM_FORMAT_H_
