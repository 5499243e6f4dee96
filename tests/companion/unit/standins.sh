#!/bin/sh
# The tools that the checks of a unit ask, on a stand-in unit: its search path holds a link to this file for each of
# them, and nothing else. They answer as the real ones do. What the unit is like comes from the file "settings" in the
# folder above: UNIT is the folder of the stand-in unit, the other names are the bench's for the keys of a scenario.
# shellcheck disable=SC2154 # the settings
set -u

tool=${0##*/}
# shellcheck source=/dev/null
. "${0%/*}/../settings"

fail() { # STATUS MESSAGE
    echo "$2" >&2
    exit "$1"
}

# Every call is noted: a test can tell what was run.
printf '%s\n' "$tool $*" >>"$UNIT/calls"

systemctl() {
    case $1 in
    show-environment) printf '%s\n' "$UNIT_ENVIRONMENT" ;;
    show)
        state=loaded
        active=$UNIT_HARL
        [ "$HEAD_HARL" = known ] || state=not-found active=inactive
        printf 'Id=harl.service\nLoadState=%s\nActiveState=%s\nEnvironment=\n\n' "$state" "$active"
        printf 'Id=harl-updater.service\nLoadState=%s\nActiveState=%s\nEnvironment=%s\n' \
            "$UNIT_UPDATER_LOADED" "$UNIT_UPDATER" "$UNIT_SERVICE_ENVIRONMENT"
        ;;
    esac
}

i2cset() {
    case $4 in
    0x100) fail 1 "Error: Data address invalid!" ;;
    esac
    [ "$HEAD_PANEL" = present ] || fail 1 "Error: Write failed"
}

i2cdetect() {
    [ "$*" = "-y -a -r 0 0x07 0x07" ] || fail 1 "Error: Unsupported option"
    answer=07
    [ "$HEAD_PANEL" = present ] || answer=--
    echo "     0  1  2  3  4  5  6  7  8  9  a  b  c  d  e  f"
    echo "00:                      $answer                         "
}

aplay() {
    [ "$HEAD_SOUND" = present ] || fail 1 "aplay: main:831: audio open error: No such file or directory"
}

ssh() {
    case $BOARD_LINK in
    down | hangs) fail 255 "ssh: connect to host 192.168.9.2 port 22: Connection timed out" ;;
    esac
    case $BOARD_LOGIN in
    key-refused) fail 255 "root@192.168.9.2: Permission denied (publickey)." ;;
    host-key-changed)
        echo "@    WARNING: REMOTE HOST IDENTIFICATION HAS CHANGED!     @" >&2
        fail 255 "Host key verification failed."
        ;;
    esac
    [ -n "$BOARD_VERSION_FILE" ] || fail 1 "cat: /root/App/AppExe/version.txt: No such file or directory"
    before=${BOARD_VERSION_FILE%%"{version}"*}
    after=${BOARD_VERSION_FILE#*"{version}"}
    printf '%s%s%s' "$before" "$BOARD_INSTALLED" "$after" | /bin/grep Brimvale
}

case $UPDATER_PROGRAM in
main) package=solvik4-dh ;;
*) package=solvik4-rh ;;
esac

known() { # PACKAGE
    [ "$PACKAGE_KNOWN" = true ] && [ "$1" = "$package" ]
}

installed() { # PACKAGE
    known "$1" && [ "$PACKAGE_INSTALLED" != "(none)" ]
}

dpkg() {
    [ "$1" = --verify ] || fail 2 "dpkg: error: need an action option"
    installed "$2" || fail 1 "dpkg: package '$2' is not installed"
}

# shellcheck disable=SC2016 # fields of dpkg-query
dpkg_query() {
    [ $# -eq 2 ] || installed "$3" || fail 1 "dpkg-query: no packages found matching $3"
    case "$1 $2" in
    '--show --showformat=${db:Status-Status}') printf installed ;;
    '--show --showformat=${Version}') printf %s "$PACKAGE_INSTALLED" ;;
    '--show --showformat=${Conffiles}\n') printf '\n /etc/harl.conf 0123\n /etc/panel.conf 4567 obsolete\n' ;;
    '--show --showformat=${db:Status-Abbrev}\t${binary:Package}\n')
        printf 'ii \tapt\nii \tdpkg\n'
        ! installed "$package" || printf '%s \t%s\n' "$UNIT_PACKAGE" "$package"
        ;;
    *) fail 2 "dpkg-query: error: unknown option" ;;
    esac
}

journalctl() {
    [ -z "$UNIT_JOURNAL" ] || /bin/cat "$UNIT_JOURNAL"
}

apt_cache() {
    [ "$1" != -c ] || shift 2
    case $1 in
    policy)
        if known "$2"; then
            printf '%s:\n  Installed: %s\n  Candidate: %s\n  Version table:\n' \
                "$package" "$PACKAGE_INSTALLED" "$PACKAGE_OFFERED"
        fi
        [ "${3-}" != apt ] || printf 'apt:\n  Installed: 2.6.1\n  Candidate: 2.6.1\n  Version table:\n'
        ;;
    show)
        known "$3" || fail 100 "E: No packages found"
        printf 'Package: %s\nVersion: %s\nInstalled-Size: 2048\nSize: 1000000\n' "$package" "$PACKAGE_OFFERED"
        ;;
    esac
}

apt_get() {
    index=http://mirror.invalid/dists/stable/InRelease
    case $* in
    *--print-uris*) echo "'$index' mirror.invalid_dists_stable_InRelease 0 " ;;
    *) [ "$MIRRORS_REFRESH" = works ] || echo "W: Failed to fetch $index  Could not resolve 'mirror.invalid'" >&2 ;;
    esac
}

apt_config() {
    [ "$*" = dump ] || fail 100 "E: Invalid operation $1"
    printf 'APT "";\nAPT::Architecture "armhf";\nDPkg::Options "";\n'
}

case " $TOOLS_KILLED " in
*" $tool "*) kill -KILL $$ ;;
esac
case $tool in
apt-cache) apt_cache "$@" ;;
apt-config) apt_config "$@" ;;
apt-get) apt_get "$@" ;;
dpkg-query) dpkg_query "$@" ;;
umount | rm | ls | apt | scp) ;; # asked for, not run
*) "$tool" "$@" ;;
esac
