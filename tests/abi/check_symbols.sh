#!/bin/sh
# Compares what the shared library exports with the committed list: a change to
# the interface shows as a diff here, to be committed with the change.
# Usage: check_symbols.sh LIBRARY LIST   (WRITE=1 rewrites LIST instead)
set -eu
exported=$(nm -D --defined-only "$1" | awk '$2 != "A" { print $3 }' | sed 's/@.*//' | c++filt | LC_ALL=C sort)
if [ "${WRITE:-0}" = 1 ]; then
    echo "$exported" >"$2"
    exit 0
fi
if ! echo "$exported" | diff -u "$2" -; then
    echo "the library's exported symbols changed: if that is meant, run WRITE=1 $0 $*"
    exit 1
fi
echo "$(echo "$exported" | wc -l) symbols, as listed"
