#!/bin/sh
# Checks that a format whose arguments do not fit its conversions is refused
# when the call is compiled, and that the fitting calls compile.
# Usage: format_mismatch_check.sh CXX SOURCE_DIR
set -u
cxx="$1"
src="$2"

compile() {
  printf '#include <string>\n#include <vector>\n#include "platform/format.h"\nstd::string f() { return %s; }\n' "$1" |
    "$cxx" -std=c++20 -I"$src" -fsyntax-only -x c++ - 2>&1
}

status=0
for call in 'vtr::Format("%d %s %@ %lld %llu %x %02ld %4ld %%", 1, "s", std::string("o"), 1LL, 2ULL, 3u, 4L, 5L)'; do
  if ! out=$(compile "$call"); then
    echo "FAIL: should compile: $call"; echo "$out" | head -5; status=1
  fi
done

for call in \
  'vtr::Format("%d", 5L)' \
  'vtr::Format("%s", 5)' \
  'vtr::Format("%@", 5)' \
  'vtr::Format("%d %d", 1)' \
  'vtr::Format("%d", 1, 2)' \
  'vtr::Format("%lld", 1.0)' \
  'vtr::Format("%y", 1)' \
  'vtr::Format("%llu", -1LL)' \
  'vtr::Format("%x", 1ULL)' \
  'vtr::Format("%@", std::vector<int>{})' \
  'vtr::Format("%", 1)'; do
  out=$(compile "$call")
  if [ $? -eq 0 ]; then
    echo "FAIL: compiled although the arguments do not fit: $call"; status=1
  elif ! echo "$out" | grep -q format_string_does_not_match_its_arguments; then
    echo "FAIL: refused for another reason: $call"; echo "$out" | head -5; status=1
  fi
done
[ $status -eq 0 ] && echo "format mismatches are compile errors"
exit $status
