"""Keys for gpg, and repositories that they sign."""

import subprocess
import tempfile
from datetime import UTC, datetime, timedelta
from hashlib import sha256
from pathlib import Path


def make_key(home: Path, name: str, keyring: Path) -> None:
    """A gpg key in the folder `home`, and a keyring with its public half."""
    home.mkdir(mode=0o700, exist_ok=True)
    command = ["gpg", "--homedir", str(home), "--batch", "--quiet"]
    subprocess.run([*command, "--passphrase", "", "--quick-generate-key", name, "ed25519", "sign", "never"], check=True)
    with keyring.open("wb") as out:
        subprocess.run([*command, "--export", name], stdout=out, check=True)


def end_agent(home: Path) -> None:
    """Ends gpg's agent for the folder: ending late, it would remove the socket of the next one there."""
    subprocess.run(["gpgconf", "--homedir", str(home), "--kill", "all"], check=True)


def sign_index(repository: Path, keyring: Path, fault: str) -> None:
    """Signs the index of the folder `repository` for apt and writes the keyring that verifies it.

    @param fault  "wrong-key": the keyring has another key; "expired", "not-yet-valid": of the release file;
                  "half-synchronised": the index is not the one that was signed; any other text: no fault
    """
    begin = datetime.now(UTC) + {"expired": -timedelta(days=30), "not-yet-valid": timedelta(days=7)}.get(
        fault, -timedelta(hours=1)
    )
    packages = (repository / "Packages").read_bytes()
    release = (
        f"Date: {begin:%a, %d %b %Y %H:%M:%S UTC}\n"
        f"Valid-Until: {begin + timedelta(days=7):%a, %d %b %Y %H:%M:%S UTC}\n"
        f"SHA256:\n {sha256(packages).hexdigest()} {len(packages)} Packages\n"
    )
    with tempfile.TemporaryDirectory(prefix="keys-", ignore_cleanup_errors=True) as folder:
        home = Path(folder) / "home"
        make_key(home, "mirror", keyring)
        command = ["gpg", "--homedir", str(home), "--batch", "--quiet", "--clear-sign"]
        signed = subprocess.run(command, input=release.encode(), stdout=subprocess.PIPE, check=True).stdout
        (repository / "InRelease").write_bytes(signed)
        if fault == "wrong-key":
            make_key(home, "other", keyring)
        end_agent(home)
    if fault == "half-synchronised":
        (repository / "Packages").write_bytes(packages + b"\n")
