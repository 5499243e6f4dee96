"""Mounts that the rest of the machine does not see."""

import ctypes
import subprocess

CLONE_NEWNS = 0x20000  # linux/sched.h


def separate_mounts() -> None:
    """From now on only this process and its children see what they mount; it ends with them. Needs root."""
    if ctypes.CDLL(None, use_errno=True).unshare(CLONE_NEWNS) != 0:
        raise OSError(ctypes.get_errno(), "no mounts of its own")
    subprocess.run(["mount", "--make-rprivate", "/"], check=True)
