#!/bin/sh
# The real unit, in namespaces of its own: unit.py runs this as their first process, and everything ends with it.
#
# Usage: unit.sh FOLDER [ACTION WORD...]
# FOLDER holds what unit.py has prepared: `head`, `board` and `stick` with the files of each, `variables` with the
# scenario, and `out` for what the unit writes. The roots lie in a tmpfs that only these namespaces see.
# An ACTION is one of the functions below, on the unit whose namespaces the caller has entered.
set -eu

PATH=$PATH:/usr/sbin:/sbin # a plain user's goes without
folder=$1
shift
here=$(dirname "$0")
makers=$here/../makers
head=$folder/unit/head
board=$folder/unit/board
# shellcheck disable=SC1091 # made by unit.py
. "$folder/variables"
# shellcheck source=bench/makers/root.sh
. "$makers/root.sh"

fail() {
    echo "$*" >&2
    exit 1
}

start_board() {
    make_root "$board" / 1000
    if [ "$BOARD_DISK" = full ]; then mount -t tmpfs -o size=64k disk "$board/root"; fi
    add_files "$board" "$folder/board"
    mkfifo "$board/run/requests" "$board/run/answers"
    own_network=$(readlink /proc/self/ns/net)
    unshare --net --uts "$here/board.sh" "$board" "$BOARD_LINK" "$BENCH_SSHD" 2>"$folder/out/board" &
    pid=$!
    while [ "$(readlink "/proc/$pid/ns/net")" = "$own_network" ]; do sleep 0.01; done
    ip link set lo up
    ip link add eth0 type veth peer name eth0 netns "$pid"
    ip address add 192.168.9.1/24 dev eth0
    ip link set eth0 up
    case $BOARD_LINK in
    slow | dies) tc qdisc add dev eth0 root tbf rate 512kbit burst 8k latency 1s ;;
    esac
}

request_of_board() {
    echo "$1" >"$board/run/requests"
    read -r _ <"$board/run/answers"
}

wait_for_board() {
    tries=0
    until [ -s "$board/run/sshd.pid" ]; do # its port answers later: an early connection would cost a second
        tries=$((tries + 1))
        [ $tries -lt 1000 ] || fail "the board's sshd did not start: $(cat "$folder/out/board")"
        sleep 0.01
    done
    case $BOARD_LINK in
    down) link_down ;;
    hangs) board_hangs ;;
    esac
}

start_mirror() {
    [ "$MIRRORS_SERVER" != file ] || return 0
    if [ "$MIRRORS_SERVER" = slow ]; then
        ip link set lo mtu 1500 # a packet must fit into the burst
        tc qdisc add dev lo root tbf rate 8kbit burst 2k latency 10s
    fi
    "$BENCH_PYTHON" -I "$here/mirror.py" "$head/srv/repository" "$BENCH_MIRROR_PORT" "$MIRRORS_SERVER" \
        2>"$folder/out/mirror" &
    until [ -n "$(ss --no-header --listening --tcp "sport = $BENCH_MIRROR_PORT")" ]; do sleep 0.01; done
}

# A package database with the older package in it, made by dpkg itself.
install_package() {
    cd "$head"
    for package in srv/installed/*.deb; do
        [ -e "$package" ] || continue
        in_head dpkg --install "/$package" >"$folder/out/dpkg" 2>&1 || fail "$(cat "$folder/out/dpkg")"
    done
    # A configuration file that was changed on the unit: dpkg asks which one to keep.
    if [ "$PACKAGE_INSTALL" = asks ]; then echo changed >>"etc/$BENCH_PACKAGE.conf"; fi
    # A refresh that fails leaves the lists of an earlier one.
    case " $TOOLS_KILLED " in
    *" apt "*) in_head apt-get update >"$folder/out/apt" 2>&1 || fail "$(cat "$folder/out/apt")" ;;
    esac
    cd /
}

in_head() {
    set -- env -i HOME=/root LANG=C.UTF-8 PATH=/opt/bench/bin:/usr/sbin:/usr/bin:/sbin:/bin "$@"
    if [ -e "$folder/out/systemd.pid" ]; then
        read -r parent <"$folder/out/systemd.pid"
        nsenter --all --target "$(tr -d ' ' <"/proc/$parent/task/$parent/children")" --root --wd "$@"
    else
        chroot "$head" "$@"
    fi
}

# The unit's parts, each in its two states: before the updater starts as the scenario says, later as the user does.
stick_in() {
    mount -t tmpfs stick "$head/root/USB_MOUNT"
    cp -r "$folder/stick/." "$head/root/USB_MOUNT"
}
stick_out() {
    # Lazily: a copy from it may be running. The updater may have released it.
    if mountpoint --quiet "$head/root/USB_MOUNT"; then umount --lazy "$head/root/USB_MOUNT"; fi
}
link_up() { request_of_board link-up; }
link_down() { request_of_board link-down; }
board_works() { request_of_board go-on; }
board_hangs() { request_of_board hang; }
mirrors_up() { mv "$head/srv/unreachable" "$head/srv/repository"; }
mirrors_down() { mv "$head/srv/repository" "$head/srv/unreachable"; }
sound_on() { mv "$head/etc/asound.absent" "$head/etc/asound.conf"; }
sound_off() { mv "$head/etc/asound.conf" "$head/etc/asound.absent"; }
bus_up() { ln -s out "$head/opt/bench/bus"; }
bus_down() { rm "$head/opt/bench/bus"; }

power_on() {
    if [ -n "$BENCH_CONTROL_GROUP" ]; then
        echo >"$folder/out/again"
    elif [ "$HEAD_HARL" = known ]; then
        echo active >"$head/run/harl"
    fi
}

# Everything that runs on the head has its root. Its disk stays.
power_off() {
    rm -f "$folder/out/systemd.pid"
    until [ -z "$(end_head)" ]; do sleep 0.02; done
    [ -n "$BENCH_CONTROL_GROUP" ] || until [ -e "$folder/out/status" ]; do sleep 0.01; done
    stick_out
    umount --lazy --recursive "$head/run"
    mount -t tmpfs -o mode=755 run "$head/run"
    if [ -n "$BENCH_CONTROL_GROUP" ]; then
        umount --lazy --recursive "$head/sys"
        find "$BENCH_CONTROL_GROUP" -mindepth 1 -depth -type d -exec rmdir {} +
    fi
}

end_head() {
    for process in /proc/[0-9]*; do
        [ "$(readlink "$process/root")" != "$head" ] || kill -s KILL "${process#/proc/}" || continue
        [ "$(readlink "$process/root")" != "$head" ] || echo "$process"
    done
}

update_again() {
    if [ -n "$BENCH_CONTROL_GROUP" ]; then
        in_head systemctl reset-failed "$BENCH_SERVICE" 2>"$folder/out/systemctl" || true
        in_head systemctl start --no-block "$BENCH_SERVICE"
    else
        echo >"$folder/out/again"
    fi
}

# Other events on the head while the updater runs.
start_events() {
    if [ "$PACKAGE_INSTALL" = locked ]; then
        in_head apt-get --assume-yes install /srv/other.deb >"$folder/out/other" 2>&1 &
        until [ -e "$head/run/other-package-installs" ]; do sleep 0.01; done
    fi
    if [ "$UPDATER_STOPPED" = in-install ] && [ -z "$BENCH_CONTROL_GROUP" ]; then # systemd does it by itself
        (until [ -e "$head/run/package-installs" ]; do sleep 0.01; done && in_head systemctl stop harl-updater) &
    fi
}

# Runs the updater to its end, in a session of its own as a service is.
run_updater() {
    : >"$folder/out/log"
    # shellcheck disable=SC2086 # several words, intended
    setsid chroot "$head" $BENCH_COMMAND <"$head/opt/bench/input" >>"$folder/out/log" 2>>"$folder/out/$BENCH_ERRORS" &
    updater=$!
    echo $updater >"$head/run/unit.pid"
    echo >"$folder/out/started"
    status=0
    wait $updater || status=$?
    echo "exited $status" >"$folder/out/status.part"
    mv "$folder/out/status.part" "$folder/out/status"
}

# Runs systemd as the first process of the head's own process namespace, until the power is cut. TARGET is "bench" to
# run the updater as one of its services, "instrument" for the others alone.
run_systemd() { # TARGET
    (become_systemd "$BENCH_CONTROL_GROUP" "$head" "$1.target" --pid --ipc --fork --kill-child) \
        </dev/null >"$folder/out/systemd" 2>&1 &
    systemd=$!
    echo $systemd >"$folder/out/systemd.pid"
    echo >"$folder/out/started"
    # journalctl fails until the journal has its first entry. It ends with the head.
    until in_head journalctl --directory=/run/log/journal --follow --no-tail --quiet --output=cat \
        "_SYSTEMD_UNIT=$BENCH_SERVICE" >>"$folder/out/journal" 2>"$folder/out/journalctl"; do
        [ -e "$folder/out/systemd.pid" ] || exit
        sleep 0.02
    done &
    wait $systemd || true
    [ ! -e "$folder/out/systemd.pid" ] || fail "systemd has ended: $(tail -n 1 "$folder/out/systemd")"
}

if [ $# -gt 0 ]; then
    "$@"
    exit
fi

mount -t tmpfs unit "$folder/unit"
start_board
make_root "$head" / 0
add_files "$head" "$folder/head"
mount --bind "$folder/out" "$head/opt/bench/out"
mount --bind "$board/run" "$head/opt/bench/board"
start_mirror
install_package
[ "$STICK_INSERTED" = false ] || stick_in
[ "$HEAD_PANEL" = absent ] || bus_up
wait_for_board
mkfifo "$folder/out/again"
if [ -n "$BENCH_CONTROL_GROUP" ]; then
    start_events
    run_systemd bench
    while read -r _ <"$folder/out/again"; do run_systemd instrument; done
else
    echo active >"$head/run/harl"
    start_events
    run_updater
    # unit.py reads the unit's state, then ends it. A line in `again` requests one more run on the unit as it is.
    while read -r _ <"$folder/out/again"; do run_updater; done
fi
