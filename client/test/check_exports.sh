#!/bin/sh
# check_exports.sh LIBRARY MAP HEADER...: what the library shows, what its map lists and what the headers declare
# must be the same.
set -eu
library=$1
map=$2
shift 2
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
nm -D --defined-only "$library" | awk '$2 != "A" { sub(/@.*/, "", $3); print $3 }' | sort -u >"$work/shown"
sed -n 's/^    \(tarnel_[a-z0-9_]*\);$/\1/p' "$map" | sort -u >"$work/listed"
cat "$@" | tr '\n' ' ' | sed 's/TARNEL_API/\n&/g' | sed -n 's/^TARNEL_API [^(]*[ *]\(tarnel_[a-z0-9_]*\)(.*/\1/p' |
  sort -u >"$work/declared"
test -s "$work/shown"
diff "$work/listed" "$work/shown"
diff "$work/listed" "$work/declared"
