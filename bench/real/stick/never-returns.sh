#!/bin/sh
# Hangs; the connection breaks after a time that the scenario sets.
read -r parent </proc/$PPID/comm
session=$PPID
if [ "$parent" = sh ]; then session=$(cut -d ' ' -f 4 "/proc/$PPID/stat"); fi
(sleep 3 && kill -s KILL "$session") &
sleep infinity
