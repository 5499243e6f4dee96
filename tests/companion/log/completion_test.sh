#!/bin/bash
# Usage: log_completion_test.sh TOOL
# Completes command lines as bash does, and compares commands and options with the tool's own help and with its manual
# page.
set -u
cd "$(dirname "$0")/../../.." || exit
tool=$1
wrong=0
# shellcheck source=companion/harl-updater-tool.bash-completion
. companion/harl-updater-tool.bash-completion

# Prints what the last of the words completes to, in order, with blanks between.
completed() { # WORD...
    COMP_WORDS=(harl-updater-tool "$@")
    COMP_CWORD=$#
    _harl_updater_tool
    printf '%s\n' "${COMPREPLY[@]}" | sort | paste -sd ' '
}

expect() { # EXPECTED WORD...
    local expected=$1 found
    shift
    found=$(completed "$@")
    [[ $found == "$expected" ]] && return
    echo "harl-updater-tool $*: completed to \"$found\", not to \"$expected\""
    wrong=1
}

# The long options in a command's help.
helped() { # [COMMAND]
    "$tool" "$@" --help | grep -oE '^ +(-[hV],)?--[a-z]+' | grep -oE -- '--[a-z]+' | sort | paste -sd ' '
}

commands=$("$tool" --help | sed -n '/^Subcommands:/,$s/^  \([a-z]*\) .*/\1/p' | sort | paste -sd ' ')
[[ $commands == 'check explain fleet log report stick unit verify' ]] || { echo "the tool's commands are \"$commands\"" && wrong=1; }
expect "$(helped | sed 's/$/ check explain fleet help log report stick unit verify/')" ''
for command in $commands; do
    expect "$(helped "$command")" "$command" --
    expect "$(helped "$command")" "$command" --json --
done
expect "$(helped stick make)" stick make --
for option in $(helped) $(helped stick make) $(for command in $commands; do helped "$command"; done); do
    grep -q -- "${option//-/\\\\-}" docs/man/harl-updater-tool.1 || { echo "the manual page lacks $option" && wrong=1; }
done

expect stick s
expect '' stick --panel
expect --follow log --journal --f
expect '--html' log --ht
expect '--last --list' log --l
expect '--failed' fleet --f
expect '' nonsense --

folder=$(mktemp -d)
trap 'rm -rf "$folder"' EXIT
mkdir "$folder/a stick"
touch "$folder/an update.log"
expect "$folder/a stick" stick "$folder/a"
expect "$folder/a stick $folder/an update.log" log "$folder/a"
expect "$folder/an update.log" log --html "$folder/an"
expect "$folder/an update.log" stick make --archive "$folder/an"
expect '' unit "$folder/a"
exit $wrong
