# shellcheck shell=sh
# Roots in a mount namespace of their own. Source it, with `makers` set to this folder.

# Makes ROOT a root with the programs of the root file system SYSTEM: its /usr read-only, devices of its own, and
# everything else empty. Its one user is root, with the number USER_ID. /proc is that of the caller.
make_root() { # ROOT SYSTEM USER_ID
    mkdir -p "$1"
    mount --bind "$1" "$1"
    cd "$1" || exit
    mkdir -p usr proc dev run tmp etc root opt srv var/log
    chmod 1777 tmp
    for link in bin sbin lib lib64; do ln -sfn "usr/$link" "$link"; done
    mount --rbind "${2%/}/usr" usr
    mount -o remount,bind,ro usr
    mount --bind /proc proc
    mount -t tmpfs -o mode=755 run run
    mount -t tmpfs -o mode=755 dev dev
    mkdir dev/pts dev/shm
    for device in null zero full random urandom tty; do
        : >"dev/$device"
        mount --bind "/dev/$device" "dev/$device"
    done
    ln -s /proc/self/fd dev/fd
    mount -t devpts -o newinstance,ptmxmode=666 devpts dev/pts
    ln -s pts/ptmx dev/ptmx
    cp -rP "${2%/}/etc/ld.so.cache" "${2%/}/etc/alternatives" etc/
    if [ -e /etc/localtime ]; then cp -L /etc/localtime etc/localtime; fi
    printf 'root:x:%s:%s::/root:/bin/sh\n' "$3" "$3" >etc/passwd
    printf 'root:x:%s:\n' "$3" >etc/group
    cd /
}

# Copies FILES into ROOT, the head's or the board's own.
add_files() { # ROOT FILES
    cp -r "$2/." "$1"
    chmod 700 "$1/root"
    if [ -d "$1/root/.ssh" ]; then
        chmod 700 "$1/root/.ssh"
        chmod 600 "$1"/root/.ssh/*
    fi
}

# Becomes the systemd of ROOT, which starts TARGET. GROUP is the root of the control groups that it sees; the options of
# unshare(1) are for more namespaces.
become_systemd() { # GROUP ROOT TARGET [OPTION...]
    group=$1 root=$2 target=$3
    shift 3
    umount "$root/proc"
    mkdir -p "$root/sys"
    mount -t sysfs -o ro sysfs "$root/sys"
    : >"$root/dev/console"
    tr -d - </proc/sys/kernel/random/uuid >"$root/etc/machine-id"
    # The group is joined before the namespace is made: it becomes the root of that.
    sh -c 'echo $PPID' >"$group/cgroup.procs"
    # shellcheck disable=SC2154 # the caller sets `makers`
    exec unshare --cgroup "$@" "$makers/systemd.sh" "$root" "$target"
}
