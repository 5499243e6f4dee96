#!/bin/sh
set -eu
unzip -q -o /root/OSUpgrade.zip -d /root/App/AppExe
