#!/bin/sh
# check_examples.sh DOCUMENT EXAMPLE...: the document shows each example as it is built.
set -eu
document=$(cat "$1")
shift
for example in "$@"; do
  shown=$(sed 's/^\(.\)/    \1/' "$example")
  case $document in
    *"$shown"*) ;;
    *)
      echo "the document does not show $example as it is" >&2
      exit 1
      ;;
  esac
done
