#pragma once

/// @file
/// The command lines of the updater, for tests to compare with.

const char mirrorsCommand[] = "apt update";
const char policyCommand[] = "apt-cache policy solvik4-rh";
const char installCommand[] = "apt --assume-yes install solvik4-rh";
const char boardVersionCommand[] =
    "ssh  -o ServerAliveInterval=4 -o ServerAliveCountMax=10 -o ConnectTimeout=2 -o TCPKeepAlive=yes 192.168.9.2 "
    "\" cat /root/App/AppExe/version.txt | grep 'Brimvale'\"";
const char stickVersionCommand[] = "ls /root/USB_MOUNT/debs/QUORB/armhf/";
const char uploadCommand[] =
    "scp  -o ServerAliveInterval=4 -o ServerAliveCountMax=10 -o ConnectTimeout=2 -o TCPKeepAlive=yes "
    "/root/USB_MOUNT/debs/QUORB/armhf/*/OSUpgrade.zip 192.168.9.2:/root/ && "
    "scp  -o ServerAliveInterval=4 -o ServerAliveCountMax=10 -o ConnectTimeout=2 -o TCPKeepAlive=yes "
    "/root/USB_MOUNT/debs/QUORB/armhf/*/unzipUpgrade.sh 192.168.9.2:/";
const char boardScriptCommand[] =
    "ssh  -o ServerAliveInterval=4 -o ServerAliveCountMax=10 -o ConnectTimeout=2 -o TCPKeepAlive=yes 192.168.9.2 "
    "\"/unzipUpgrade.sh\"";
const char markerCommand[] = "rm /root/RESOURCES/tavren1stboot";
const char teamViewerCheckCommand[] = "ls /root/USB_MOUNT/debs/installTV";
const char teamViewerMarker[] = "/root/USB_MOUNT/debs/installTV";
const char teamViewerScriptCommand[] = "/root/RESOURCES/teamviewer_updatescript.sh";

const char stopHarlCommand[] = "systemctl stop harl";
const char startHarlCommand[] = "systemctl start harl";
const char stopUpdaterCommand[] = "systemctl stop harl-updater";
const char unmountCommand[] = "umount /root/USB_MOUNT/";
const char passSoundCommand[] = "aplay /root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav";
const char failSoundCommand[] = "aplay /root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav";

/// LED codes and second bytes, in the spelling of the command lines.
const char ledRemote[] = "0x12";
const char ledPass[] = "0x13";
const char ledFail[] = "0x14";
const char ledMain[] = "0x15";
const char dark[] = "0x0";
const char blue[] = "0x1";
const char passColor[] = "0x2";
const char failColor[] = "0x8";
