#!/bin/sh
# Counts, under callgrind, the instructions of decoding a 12-entry GetProperties
# reply into a Dict against a raw iterator walk of the same reply, and of
# 2,000 plain blocking calls (no receiving thread) against libdbus's own.
# Usage: decode_instructions.sh <btbus-bench-loop> <output directory>
bench=$1
out=$2
if ! command -v valgrind >/dev/null 2>&1; then
    echo "instructions: skipped, valgrind is not installed"
    exit 0
fi
# ratio MODE RAW_FUNCTION LIBRARY_FUNCTION TEXT: the library's inclusive count
# over the raw one, each per run of the loop (1000 decodings, 2000 calls).
ratio() {
    valgrind --tool=callgrind --callgrind-out-file="$out/$1.callgrind" "$bench" "$1" >/dev/null 2>&1 || exit 1
    callgrind_annotate --inclusive=yes "$out/$1.callgrind" | awk -v raw_name="$2(" -v lib_name="$3(" \
        -v text="$4" -v runs="$5" '
        index($0, raw_name) && !raw { gsub(",", "", $1); raw = $1 }
        index($0, lib_name) && !lib { gsub(",", "", $1); lib = $1 }
        END {
            if (!raw || !lib) { print text ": no counts in the callgrind output"; exit 1 }
            printf "%s: %.1fk instructions, %.2f x raw libdbus (%.1fk)\n", text, lib / runs / 1e3, lib / raw,
                   raw / runs / 1e3
        }'
}
ratio decode rawWalk libraryDecode "decoding a 12-entry GetProperties reply into a Dict" 1000
ratio calls rawCalls libraryCalls "a plain blocking call, no receiving thread" 2000
