"""A file system whose every access is uninterruptible: a FUSE server that takes requests and never answers them.

Usage: frozen_mount.py FOLDER - mounts it there, prints so and waits. Needs root. The accesses end, with errors, when
this process ends.
"""

import ctypes
import os
import struct
import sys
import time

# linux/fuse.h: fuse_in_header {len, opcode, unique, nodeid, uid, gid, pid, padding}; fuse_out_header {len, error,
# unique}; fuse_init_out is 64 bytes and begins with the protocol's major and minor version.
HEADER = "<IIQQIIII"
INIT = 26
LARGEST_WRITE = 4096


def mount(folder: str, device: int) -> None:
    """Mounts the file system that `device` serves. Raises OSError."""
    libc = ctypes.CDLL(None, use_errno=True)
    options = f"fd={device},rootmode=40000,user_id=0,group_id=0,allow_other"
    if libc.mount(b"frozen", folder.encode(), b"fuse.frozen", 0, options.encode()) != 0:
        number = ctypes.get_errno()
        raise OSError(number, os.strerror(number), folder)


def main() -> int:
    """Serves until it is killed."""
    try:
        device = os.open("/dev/fuse", os.O_RDWR)
        mount(sys.argv[1], device)
    except OSError as error:
        print(f"no FUSE here: {error}", flush=True)
        return 1
    request = os.read(device, 1 << 20)
    _, opcode, unique, *_ = struct.unpack_from(HEADER, request)
    assert opcode == INIT
    answer = struct.pack("<IIIIHHIIHHI", 7, 31, 4096, 0, 1, 1, LARGEST_WRITE, 1, 0, 0, 0).ljust(64, b"\0")
    os.write(device, struct.pack("<IiQ", 16 + len(answer), 0, unique) + answer)
    print("mounted", flush=True)
    while True:
        os.read(device, 1 << 20)
        time.sleep(0)


if __name__ == "__main__":
    sys.exit(main())
