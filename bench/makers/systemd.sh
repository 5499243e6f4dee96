#!/bin/sh
# Becomes the systemd of a root, first process in its process namespace; see root.sh.
#
# Usage: systemd.sh ROOT TARGET
set -eu

mount -t cgroup2 cgroup2 "$1/sys/fs/cgroup"
mount -t proc proc "$1/proc"
exec chroot "$1" /usr/bin/env -i container=bench PATH=/usr/sbin:/usr/bin /lib/systemd/systemd --system \
    "--unit=$2" --log-target=journal --show-status=no
