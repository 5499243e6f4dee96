#!/bin/sh
# Ends the connection that it was started through, as a board that restarts does.
read -r parent </proc/$PPID/comm
session=$PPID
if [ "$parent" = sh ]; then session=$(cut -d ' ' -f 4 "/proc/$PPID/stat"); fi
kill -s KILL "$session"
