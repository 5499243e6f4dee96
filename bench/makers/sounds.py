"""The sounds of the instrument, as files that a test can distinguish by any piece of them."""

import math
import struct
import wave
from functools import cache
from pathlib import Path

from bench.expected import SOUND_FOLDER
from bench.outcomes import SOUND_FILES

FOLDER = SOUND_FOLDER.lstrip("/")  # below the head's root
RATE = 8000  # Hz; 16 bit, mono
SECONDS = 1.5
# Each is a sweep: its first and its last frequency, Hz.
SOUNDS = {SOUND_FILES["pass"]: (300, 900), SOUND_FILES["fail"]: (1000, 1600)}


@cache
def samples(name: str) -> bytes:
    """The samples of the sound `name`."""
    first, last = SOUNDS[name]
    count = int(RATE * SECONDS)
    turns = [(first + (last - first) * i / count / 2) * i / RATE for i in range(count)]
    return b"".join(struct.pack("<h", round(8000 * math.sin(2 * math.pi * turn))) for turn in turns)


def write_sounds(root: Path) -> None:
    """Writes the sounds below the head's `root`."""
    (root / FOLDER).mkdir(parents=True)
    for name in SOUNDS:
        with wave.open(str(root / FOLDER / name), "wb") as sound:
            sound.setnchannels(1)
            sound.setsampwidth(2)
            sound.setframerate(RATE)
            sound.writeframes(samples(name))
