#!/bin/sh
# The tools of the stand-in unit. Its search path holds a link to this file for each of them, and nothing else.
#
# UNIT is the folder that holds the unit's state; the scenario comes in one variable for each of its keys, such as
# BOARD_LINK, and BENCH_TOOLS is the folder of the tools that are the same on every unit. The tools change the state as
# the real ones would: a second run finds what the first one left.
# shellcheck disable=SC2154 # the scenario's variables
set -u

tool=${0##*/}
head=$UNIT/head   # the head's files below /root
board=$UNIT/board # the board's root
calls=$UNIT/tools
call="$tool $*"

read -r now _ </proc/uptime
echo "$now $call" >>"$calls"

fail() { # STATUS MESSAGE
    echo "$2" >&2
    exit "$1"
}

# What a user has changed since the updater started, and a time (s) in which to change more.
read_changes() {
    # shellcheck disable=SC1091 # made by unit.py
    [ ! -e "$UNIT/changes" ] || . "$UNIT/changes"
}

# A test holds the calls that match the pattern in the file BENCH_HOLD, as long as that is there.
is_held() {
    { read -r pattern <"${BENCH_HOLD:-/dev/null}"; } 2>/dev/null || return 1
    # shellcheck disable=SC2254 # a pattern, intended
    case $call in
    $pattern) ;;
    *) return 1 ;;
    esac
}

take_time() {
    [ -n "${BENCH_PACE-}" ] || return 0
    /bin/sleep "$BENCH_PACE"
    while is_held; do /bin/sleep 0.02; done
    read_changes
}

board_answers() {
    link=$BOARD_LINK # of the connection; it may change during the session
    take_time
    case $link in
    down | hangs) fail 255 "ssh: connect to host 192.168.9.2 port 22: Connection timed out" ;;
    slow) /bin/sleep 0.3 ;;
    esac
    case $BOARD_LOGIN in
    key-refused) fail 255 "root@192.168.9.2: Permission denied (publickey)." ;;
    host-key-changed) fail 255 "Host key verification failed." ;;
    esac
    # The session stays while the board hangs, and breaks when the link is cut.
    while [ "$BOARD_LINK" = hangs ]; do take_time; done
    [ "$BOARD_LINK" != down ] || fail 255 "client_loop: send disconnect: Broken pipe"
}

umount() {
    [ -L "$head/USB_MOUNT" ] || fail 32 "umount: $1: not mounted."
    /bin/rm "$head/USB_MOUNT"
    /bin/mkdir "$head/USB_MOUNT"
}

rm() {
    [ -e "$head/${1#/root/}" ] || fail 1 "rm: cannot remove '$1': No such file or directory"
    /bin/rm "$head/${1#/root/}"
}

ls() {
    [ "$STICK_TEAMVIEWER" != unreadable ] || [ "${1-}" != /root/USB_MOUNT/debs/installTV ] || fail 1 "ls: $1: failure"
    [ $# -gt 0 ] || set -- /root/ # by hand
    path=$head/${1#/root/}
    if [ -d "$path" ]; then
        /bin/ls "$path"
    elif [ -e "$path" ]; then
        echo "$1"
    else
        fail 2 "ls: cannot access '$1': No such file or directory"
    fi
}

apt() {
    echo
    echo "WARNING: apt does not have a stable CLI interface. Use with caution in scripts." >&2
    case "$*" in
    update)
        [ "$MIRRORS_REFRESH" = works ] || fail 100 "E: Failed to fetch http://mirrors/dists/stable/Release"
        echo "Reading package lists..."
        ;;
    "--assume-yes install "*)
        if [ "$UPDATER_STOPPED" = in-install ]; then
            /bin/sleep 0.3
            "$BENCH_TOOLS/systemctl" stop harl-updater
            exec /bin/sleep 60 # the package's script goes on
        fi
        [ "$MIRRORS_SERVER" != stalls ] || fail 100 "E: Failed to fetch http://mirrors/$3.deb  Connection timed out"
        [ "$PACKAGE_KNOWN" = true ] || fail 100 "E: Unable to locate package $3"
        [ "$PACKAGE_INSTALL" != locked ] || /bin/sleep 0.5
        echo "Setting up $3 ($PACKAGE_OFFERED) ..."
        echo "$PACKAGE_OFFERED" >"$UNIT/package" # also when it is then left half-configured
        case $PACKAGE_INSTALL in
        fails) fail 100 "E: Sub-process /usr/bin/dpkg returned an error code (1)" ;;
        asks) fail 100 "dpkg: error processing package $3 (--configure): end of file on stdin at conffile prompt" ;;
        esac
        ;;
    esac
}

apt_cache() {
    [ "$PACKAGE_KNOWN" = true ] || return 0
    read -r installed <"$UNIT/package"
    echo "$2:"
    echo "  Installed: $installed"
    echo "  Candidate: $PACKAGE_OFFERED"
    echo "  Version table:"
    if [ "$installed" != "$PACKAGE_OFFERED" ]; then
        echo "     $PACKAGE_OFFERED 500"
        echo "        500 file:/srv/repository ./ Packages"
    fi
    [ "$installed" = "(none)" ] || echo " *** $installed 100"
    [ "$installed" = "(none)" ] || echo "        100 /var/lib/dpkg/status"
}

ssh() {
    while [ "$1" = -o ]; do shift 2; done
    shift
    board_answers
    case $1 in
    *version.txt*)
        # shellcheck disable=SC2002 # as the board's shell does it: a missing file gives grep's status
        /bin/cat "$board/root/App/AppExe/version.txt" | /bin/grep Brimvale
        ;;
    /unzipUpgrade.sh)
        case $BOARD_SCRIPT in
        hangs-up) fail 255 "Connection to 192.168.9.2 closed by remote host." ;;
        never-returns) /bin/sleep 1 && fail 255 "Connection to 192.168.9.2 closed by remote host." ;;
        esac
        cd "$board" && /bin/sh ./unzipUpgrade.sh
        ;;
    esac
}

scp() {
    while [ "$1" = -o ]; do shift 2; done
    for target; do :; done
    board_answers
    echo >>"$UNIT/uploads"
    uploads=0
    while read -r _; do uploads=$((uploads + 1)); done <"$UNIT/uploads"
    [ "$uploads" -gt "$BOARD_UPLOADS_LOST" ] || fail 1 "scp: Connection closed"
    [ "$BOARD_LINK" = up ] || [ "$BOARD_LINK" = slow ] || fail 1 "scp: Connection closed"
    [ "$BOARD_DISK" = free ] || fail 1 "scp: write remote \"${target#*:}\": Failure"
    [ "$STICK_PULLED_OUT" = never ] || /bin/rm -f "$head/USB_MOUNT"
    while [ $# -gt 1 ]; do
        for file in "$head/"${1#/root/}; do # the head's shell found no such files on the host: its pattern came through
            [ -f "$file" ] || fail 1 "scp: stat local \"$1\": No such file or directory"
            /bin/cp "$file" "$board/${target#*:}" || exit 1
        done
        shift
    done
}

i2cset() {
    [ "$HEAD_PANEL" = present ] || fail 1 "Error: Write failed"
    case $4 in
    0x?) byte=0${4#0x} ;;
    0x??) byte=${4#0x} ;;
    *) fail 1 "Error: Data value invalid!" ;;
    esac
    echo "$now $byte" >>"$UNIT/panel"
}

aplay() {
    [ -f "$head/${1#/root/}" ] || fail 1 "$1: No such file or directory"
    [ "$HEAD_SOUND" = present ] || fail 1 "aplay: main:831: audio open error: No such file or directory"
    echo "Playing WAVE '$1'" >&2
    /bin/sleep 0.1
    echo "${1##*/}" >>"$UNIT/sounds"
}

case " $TOOLS_KILLED " in
*" $tool "*)
    exec "$BENCH_TOOLS/killed"
    ;;
esac
read_changes
case $tool in
i2cset | ssh | scp) ;; # the board's tools take their time during the session
*) take_time ;;
esac
case $tool in
apt-cache) apt_cache "$@" ;;
systemctl) exec "$BENCH_TOOLS/systemctl" "$@" ;;
*) "$tool" "$@" ;;
esac
