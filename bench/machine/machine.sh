#!/bin/sh
# Starts systemd as the first process of a machine of its own: new namespaces, in which machine.py runs this as root.
#
# Usage: machine.sh FOLDER SYSTEM GROUP [DISK]
# FOLDER/files holds the machine's files besides the /usr of the root file system SYSTEM. What the machine writes stays
# in memory, or goes to the file system in the file DISK, from which a later start continues. GROUP is its control
# group.
set -eu

folder=$1
system=$(realpath "$2")
makers=$(dirname "$0")/../makers
# shellcheck source=bench/makers/root.sh
. "$makers/root.sh"

memory=$folder/memory
root=$memory/root
mount --make-rprivate /
if [ -z "${4-}" ]; then
    mount -t tmpfs tmpfs "$memory"
else
    mount -o loop,nodiscard "$4" "$memory"
fi
is_new=true
[ ! -e "$memory/upper" ] || is_new=false
make_root "$root" "$system" 0
mkdir -p "$memory/upper" "$memory/work"
mount -t overlay -o "lowerdir=$system/usr,upperdir=$memory/upper,workdir=$memory/work" overlay "$root/usr"
printf 'systemd-journal:x:101:\ntty:x:5:\nutmp:x:43:\nadm:x:4:\n' >>"$root/etc/group"
if $is_new; then
    add_files "$root" "$folder/files"
fi
become_systemd "$3" "$root" basic.target
