// Value comparison for codec tests. Value's operator== compares numbers by
// value (5, 5u and 5.0 are equal); a codec must also keep the kind, and a
// real's sign and bits, so tests compare with StrictlyEqual instead.
#ifndef VTR_TESTS_PLATFORM_STRICT_VALUE_H_
#define VTR_TESTS_PLATFORM_STRICT_VALUE_H_

#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "platform/value.h"

namespace vtr::testing {

// Success when a and b have the same kind at every position and equal
// contents (reals and dates bit for bit); otherwise a failure naming the
// first path where they differ, e.g. "at /list/3: integer 5 vs real 5".
inline ::testing::AssertionResult StrictlyEqual(const Value& a, const Value& b, const std::string& path = "") {
  auto differ = [&](const std::string& why) {
    return ::testing::AssertionFailure() << "at " << (path.empty() ? "/" : path) << ": " << why;
  };
  auto bits = [](double d) {
    uint64_t u;
    std::memcpy(&u, &d, sizeof u);
    return u;
  };
  if (a.type() != b.type()) {
    return differ(std::string(TypeName(a.type())) + " " + a.description() + " vs " + TypeName(b.type()) + " " +
                  b.description());
  }
  switch (a.type()) {
    case Value::Type::kReal:
      if (bits(*a.real()) != bits(*b.real())) return differ(a.description() + " vs " + b.description());
      return ::testing::AssertionSuccess();
    case Value::Type::kDate:
      if (bits(a.date()->secondsSince2001) != bits(b.date()->secondsSince2001)) {
        return differ(a.description() + " vs " + b.description());
      }
      return ::testing::AssertionSuccess();
    case Value::Type::kArray: {
      const Array& x = *a.array();
      const Array& y = *b.array();
      if (x.size() != y.size()) {
        return differ("array sizes " + std::to_string(x.size()) + " vs " + std::to_string(y.size()));
      }
      for (size_t i = 0; i < x.size(); ++i) {
        if (auto r = StrictlyEqual(x[i], y[i], path + "/" + std::to_string(i)); !r) return r;
      }
      return ::testing::AssertionSuccess();
    }
    case Value::Type::kDictionary: {
      const Dictionary& x = *a.dictionary();
      const Dictionary& y = *b.dictionary();
      if (x.size() != y.size()) {
        return differ("dictionary sizes " + std::to_string(x.size()) + " vs " + std::to_string(y.size()));
      }
      for (auto i = x.begin(), j = y.begin(); i != x.end(); ++i, ++j) {
        if (i->first != j->first) return differ("keys \"" + i->first + "\" vs \"" + j->first + "\"");
        if (auto r = StrictlyEqual(i->second, j->second, path + "/" + i->first); !r) return r;
      }
      return ::testing::AssertionSuccess();
    }
    default:
      if (!(a == b)) return differ(a.description() + " vs " + b.description());
      return ::testing::AssertionSuccess();
  }
}

}  // namespace vtr::testing

#endif  // VTR_TESTS_PLATFORM_STRICT_VALUE_H_
