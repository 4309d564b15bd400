#!/bin/sh
# check_plain_c.sh CC INCLUDE ADAPTOR...: the adaptor header is plain C (and C++), and the sample adaptor and the others
# build with it as any adaptor would be built, exporting the one function.
set -eu
cc=$1
include=$2
shift 2
here=$(dirname "$0")
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT

printf '#include <tarnel/tarnel_adaptor.h>\nconst tarnel_adaptor_class* found;\n' >"$work/header.c"
for standard in c99 c11 c17; do
  "$cc" -std=$standard -pedantic -Wall -Wextra -Wstrict-prototypes -Werror -I "$include" -c "$work/header.c" \
    -o "$work/header.o"
done
"$cc" -x c++ -std=c++17 -pedantic -Wall -Wextra -Werror -I "$include" -c "$work/header.c" -o "$work/header.o"

for adaptor in "$here/sample_adaptor.c" "$@"; do
  "$cc" -std=c11 -pedantic -Wall -Wextra -Werror -I "$include" -shared -fPIC -fvisibility=hidden \
    -o "$work/adaptor.so" "$adaptor" -pthread
  if ! nm -D --defined-only "$work/adaptor.so" | grep -q ' T tarnel_adaptor_class_named$'; then
    echo "$adaptor does not export tarnel_adaptor_class_named" >&2
    exit 1
  fi
  if nm -D --undefined-only "$work/adaptor.so" | grep -q ' tarnel_'; then
    echo "$adaptor needs something of Tarnel" >&2
    exit 1
  fi
done
