#!/bin/sh
# Counts, under callgrind, the instructions of decoding a 12-entry GetProperties
# reply into a Dict against a raw iterator walk of the same reply.
# Usage: decode_instructions.sh <btbus-bench-loop> <output directory>
bench=$1
out=$2/decode.callgrind
if ! command -v valgrind >/dev/null 2>&1; then
    echo "decoding in instructions: skipped, valgrind is not installed"
    exit 0
fi
valgrind --tool=callgrind --callgrind-out-file="$out" "$bench" decode >/dev/null 2>&1 || exit 1
callgrind_annotate --inclusive=yes "$out" | awk '
    /rawWalk\(/ && !raw { gsub(",", "", $1); raw = $1 }
    /libraryDecode\(/ && !lib { gsub(",", "", $1); lib = $1 }
    END {
        if (!raw || !lib) { print "decoding in instructions: no counts in the callgrind output"; exit 1 }
        # Each ran 1000 times.
        printf "decoding a 12-entry GetProperties reply into a Dict: %.1fk instructions, %.2f x a raw iterator walk (%.1fk)\n",
               lib / 1e6, lib / raw, raw / 1e6
    }'
