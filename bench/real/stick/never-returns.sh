#!/bin/sh
# Hangs; after some time, which is the scenario's, the connection breaks.
read -r parent </proc/$PPID/comm
session=$PPID
if [ "$parent" = sh ]; then session=$(cut -d ' ' -f 4 "/proc/$PPID/stat"); fi
(sleep 3 && kill -s KILL "$session") &
sleep infinity
