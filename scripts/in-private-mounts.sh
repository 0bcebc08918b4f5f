#!/bin/sh
# Runs COMMAND in a private mount namespace where /tmp is an empty tmpfs and
# /etc an overlay whose changes go to a tmpfs: what it writes there vanishes
# with it, and the host's /etc and /tmp are never touched. Trees under /tmp
# that the command runs from (this checkout, SCRATCH, the working directory,
# TMPDIR, COMMAND itself) are bound back in at their own paths. Needs root and
# `unshare -m`; SCRATCH (an existing, empty directory) holds the mount points.
# Usage: scripts/in-private-mounts.sh SCRATCH COMMAND [ARG...]
set -eu
if [ "${1:-}" != "--inside" ]; then
    exec unshare -m --propagation private "$0" --inside "$@"
fi
scratch=$2
shift 2
# The entry of /tmp that holds each path given, if it lies under /tmp.
trees_under_tmp() {
    for path in "$@"; do
        real=$(realpath -m "$path")
        case $real in /tmp/?*) rest=${real#/tmp/}; echo "/tmp/${rest%%/*}" ;; esac
    done | sort -u
}
trees=$(trees_under_tmp "$0" "$scratch" "$PWD" "${TMPDIR:-/}" "$1")
mount -t tmpfs -o size=4m,mode=0700 btbus-private-etc "$scratch"
mkdir "$scratch/upper" "$scratch/work" "$scratch/tmp"
mount -t overlay overlay -o "lowerdir=/etc,upperdir=$scratch/upper,workdir=$scratch/work" /etc
# The new /tmp is put together aside, then moved over the host's.
mount -t tmpfs -o size=4m,mode=1777 btbus-private-tmp "$scratch/tmp"
for tree in $trees; do
    mkdir -p "$scratch/tmp${tree#/tmp}"
    mount --bind "$tree" "$scratch/tmp${tree#/tmp}"
done
mount --move "$scratch/tmp" /tmp
mkdir -p /etc/bluetooth
exec "$@"
