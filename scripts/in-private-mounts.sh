#!/bin/sh
# Runs COMMAND in a private mount namespace where /tmp is an empty tmpfs and
# /etc an overlay whose changes go to a tmpfs: what it writes there vanishes
# with it, and the host's /etc and /tmp are never touched. Needs root and
# `unshare -m`; SCRATCH (an existing, empty directory) holds the overlay's
# mount point. Usage: scripts/in-private-mounts.sh SCRATCH COMMAND [ARG...]
set -eu
if [ "${1:-}" != "--inside" ]; then
    exec unshare -m --propagation private "$0" --inside "$@"
fi
scratch=$2
shift 2
mount -t tmpfs -o size=4m,mode=0700 btbus-private-etc "$scratch"
mkdir "$scratch/upper" "$scratch/work"
mount -t overlay overlay -o "lowerdir=/etc,upperdir=$scratch/upper,workdir=$scratch/work" /etc
mount -t tmpfs -o size=4m btbus-private-tmp /tmp
mkdir -p /etc/bluetooth
exec "$@"
