#!/bin/sh
# Starts systemd as the first process of a machine of its own: new namespaces, in which machine.py runs this as root.
#
# Usage: machine.sh FOLDER SYSTEM
# FOLDER/files is what the machine has besides the /usr of the root file system SYSTEM. What it writes stays in memory.
set -eu

folder=$1
system=$(realpath "$2")
mount --make-rprivate /
mount -t tmpfs tmpfs "$folder/memory"
mkdir "$folder/memory/root" "$folder/memory/upper" "$folder/memory/work"
cd "$folder/memory/root"

mkdir -p usr proc sys dev run tmp etc/systemd/system etc/apt var/log/journal root
chmod 700 root
for link in bin sbin lib lib64; do ln -s "usr/$link" "$link"; done
mount -t overlay -o "lowerdir=$system/usr,upperdir=$folder/memory/upper,workdir=$folder/memory/work" overlay usr
cp -rP "$system/etc/ld.so.cache" "$system/etc/alternatives" etc/
printf 'root:x:0:0::/root:/bin/sh\n' >etc/passwd
printf 'root:x:0:\nsystemd-journal:x:101:\ntty:x:5:\nutmp:x:43:\nadm:x:4:\n' >etc/group
tr -d - </proc/sys/kernel/random/uuid >etc/machine-id
cp -r "$folder/files/." .

mount -t sysfs -o ro sysfs sys
umount -R /sys/fs/cgroup
mount -t cgroup2 cgroup2 /sys/fs/cgroup
mkdir "/sys/fs/cgroup/$(basename "$folder")"
echo $$ >"/sys/fs/cgroup/$(basename "$folder")/cgroup.procs"

mount -t tmpfs -o mode=755 dev dev
for device in null zero full random urandom tty; do
    : >"dev/$device"
    mount --bind "/dev/$device" "dev/$device"
done
mkdir dev/pts dev/shm
mount -t devpts -o newinstance,ptmxmode=666 devpts dev/pts
ln -s pts/ptmx dev/ptmx
ln -s /proc/self/fd dev/fd
: >dev/console
mount -t tmpfs -o mode=755 run run

# Its own view of the control groups begins at its group.
# shellcheck disable=SC2016 # for the inner shell
exec unshare --cgroup sh -c '
    mount -t cgroup2 cgroup2 sys/fs/cgroup
    mount -t proc proc proc
    exec chroot . env -i container=test PATH=/usr/sbin:/usr/bin /lib/systemd/systemd --system systemd.unit=basic.target
'
