"""Usage: mirror.py FOLDER PORT KIND: serves FOLDER as a static web server on this machine's own address.

KIND is `mirrors.server` of the scenario; "stalls": it sends half of a package, then nothing more.
"""

import sys
import time
from functools import partial
from http.server import SimpleHTTPRequestHandler, ThreadingHTTPServer
from typing import BinaryIO


class Stalling(SimpleHTTPRequestHandler):
    """Stops sending in the middle of a package."""

    def copyfile(self, source: BinaryIO, outputfile: BinaryIO) -> None:  # type: ignore[override]
        """Sends the file."""
        content = source.read()
        outputfile.write(content[: len(content) // 2] if self.path.endswith(".deb") else content)
        outputfile.flush()
        if self.path.endswith(".deb"):
            time.sleep(3600)


folder, port, kind = sys.argv[1:]
handler = Stalling if kind == "stalls" else SimpleHTTPRequestHandler
ThreadingHTTPServer(("127.0.0.1", int(port)), partial(handler, directory=folder)).serve_forever()
