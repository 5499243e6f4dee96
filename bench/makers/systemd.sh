#!/bin/sh
# Becomes systemd, first process in the head's process namespace.
#
# Usage: systemd.sh ROOT
set -eu

mount -t cgroup2 cgroup2 "$1/sys/fs/cgroup"
mount -t proc proc "$1/proc"
exec chroot "$1" /usr/bin/env -i container=bench PATH=/usr/sbin:/usr/bin /lib/systemd/systemd --system \
    --unit=bench.target --log-target=journal --show-status=no
