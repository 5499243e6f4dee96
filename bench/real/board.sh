#!/bin/sh
# The board, first process in its network namespace.
#
# Usage: board.sh ROOT LINK SSHD
set -eu

board=$1
link=$2
sshd=$3

until ip link show eth0 >/dev/null 2>&1; do sleep 0.01; done
ip address add 192.168.9.2/24 dev eth0
ip link set eth0 up
case $link in
slow | dies) tc qdisc add dev eth0 root tbf rate 512kbit burst 8k latency 1s ;; # and so does the head's end
esac
# Where there is only one user, sshd cannot change to another one: it runs as its own user, named root, instead.
echo 0 >/proc/sys/net/ipv4/ip_unprivileged_port_start
LD_LIBRARY_PATH=/opt/bench/lib unshare --user --map-user=1000 --map-group=1000 --root="$board" --wd=/ "$sshd" -D -e &

# Everything that runs on the board has its root.
signal_all() { # SIGNAL
    for process in /proc/[0-9]*; do
        if [ "$(readlink "$process/root")" = "$board" ]; then kill -s "$1" "${process#/proc/}"; fi
    done
}

# Events on the board that others request.
while read -r request <"$board/run/requests"; do
    case $request in
    link-down) ip link set eth0 down ;;
    link-up) ip link set eth0 up ;;
    hang) signal_all STOP ;;
    go-on) signal_all CONT ;;
    esac
    echo >"$board/run/answers"
done
