"""prepare, which runs before the updater, on stand-in tools."""

import re
from pathlib import Path

import pytest

from tests.commands import run_command

from tests.service.stand_in import StandIn

CALL = 'call="${0##*/} $*"; echo "$call" >>"$UNIT/calls"\n'
# The call that MENDED names leaves these packages.
MENDS = CALL + 'case $call in "$MENDED"*) rm -f "$UNIT/updates/"*; echo "$LEFT" >"$UNIT/packages" ;; esac\n'
TOOLS = {
    "apt-cache": CALL + 'cat "$UNIT/policy"',
    "apt-get": MENDS,
    "dpkg": MENDS + 'cat >"$UNIT/selections"',
    "dpkg-query": r"""[ "$*" != '--show --showformat ${db:Status-Abbrev}${Package}\n' ] || cat "$UNIT/packages" """,
    "journalctl": CALL + 'echo "a line"; echo "-- cursor: s=1;i=2"; echo "a warning" >&2',
    "sleep": CALL,
    "systemctl": CALL + 'if [ "$1" = show ]; then head -n 1 "$UNIT/jobs"; sed -i 1d "$UNIT/jobs"; fi',
    "verify-stick": CALL + 'echo "$PATH" >"$UNIT/path"; cat "$UNIT/wrong"',
}
CHANGES = {
    "/var/lib/dpkg/updates": '"$UNIT/updates"',
    "keyring=/usr/share/keyrings/harl-updater-stick.gpg": 'keyring="$UNIT/keyring"',
    "[ ! -f /etc/apt/apt.conf ]": '[ ! -f "$UNIT/apt.conf" ]',
}
JOBS = "systemctl show --property=ActiveState apt-daily.service apt-daily-upgrade.service"
STOP = "systemctl stop harl"
CONFIGURE = "dpkg --configure --pending --force-confdef --force-confold"
TAKE_OVER = "dpkg --set-selections"
REFRESH = "apt-get update"
POLICY = "apt-cache policy solvik4-rh"
MEND = "apt-get --assume-yes --fix-broken install"
REINSTALL = "apt-get --assume-yes --reinstall install"
BROKEN = "iF solvik4-rh\n"


class Unit(StandIn):
    """A unit on which nothing is broken, with a stick that nobody has to verify."""

    def __init__(self, folder: Path) -> None:
        super().__init__(folder, "prepare", TOOLS, CHANGES)
        self.environment |= {"MENDED": "nothing", "LEFT": "ii solvik4-rh"}
        (folder / "updates").mkdir()
        self.write(packages="ii solvik4-rh\nrc solvik4-old\nun other\nhi held\n", jobs="", wrong="")
        self.offer("1.3.0")

    def write(self, **texts: str) -> None:
        for name, text in texts.items():
            (self.folder / name).write_text(text)

    def offer(self, candidate: str) -> None:
        self.write(policy=f"solvik4-rh:\n  Installed: 1.2.0\n  Candidate: {candidate}\n  Version table:\n")

    def prepare(self, status: int = 0) -> str:
        """Runs it; returns its output."""
        done = run_command(self.folder / "prepare", environment=self.environment)
        assert (done.stderr, done.returncode) == ("", status)
        return done.stdout

    def repairs(self) -> list[str]:
        """The calls that change something, or find out what would."""
        return [call for call in self.calls("dpkg", "apt-get", "apt-cache", "systemctl") if call != JOBS]


@pytest.fixture
def unit(tmp_path: Path) -> Unit:
    return Unit(tmp_path)


def test_notes_of_the_run_begin(unit: Unit) -> None:
    (unit.folder / "run/select").touch()
    (unit.folder / "run/give-back").mkdir()
    assert unit.prepare() == ""
    files = {path.name: path.read_text() for path in (unit.folder / "run").iterdir()}
    assert re.search(r"^\d+\.\d\d prepared\n$", files.pop("notes"))
    last = '#include "/usr/lib/harl-updater/apt-last.conf";\n'
    assert files == {"cursor": "s=1;i=2\n", "apt.conf": last}
    assert unit.calls() == ["journalctl --identifier=harl-updater --show-cursor --lines=0", JOBS]
    unit.write(**{"apt.conf": ""})
    unit.prepare()
    assert (unit.folder / "run/apt.conf").read_text() == f'#include "/etc/apt/apt.conf";\n{last}'


@pytest.mark.parametrize("target", ["/dev/null", "/nowhere"])
def test_stick_is_verified_where_a_keyring_is_installed(unit: Unit, target: str) -> None:
    (unit.folder / "keyring").symlink_to(target)
    assert unit.prepare() == ""
    assert unit.calls("verify-stick") == [f"verify-stick /root/USB_MOUNT {unit.folder}/keyring"]
    path = unit.environment["PATH"]
    assert (unit.folder / "path").read_text() == f"{path}:/usr/lib/harl-updater\n"


@pytest.mark.parametrize(
    "wrong, said",
    [("changed: x\nadded: y\n", ["changed: x", "added: y"]), ("", ["it cannot be read"])],
    ids=["changed", "unreadable"],
)
def test_stick_that_is_not_the_makers_keeps_the_updater_from_running(unit: Unit, wrong: str, said: list[str]) -> None:
    unit.write(keyring="", wrong=wrong, packages=BROKEN, jobs="ActiveState=active\n")
    with (unit.folder / "bin/verify-stick").open("a") as tool:
        tool.write("exit 1\n")
    lines = [f"prepare: the stick is not as the maker signed it: {what}\n" for what in said]
    assert unit.prepare(status=1) == "".join(lines) + "prepare: the updater is not run\n"
    assert unit.calls("systemctl", "dpkg", "apt-get") == []
    assert (unit.folder / "run/notes").exists()


def test_jobs_of_apts_own_timers_are_waited_for(unit: Unit) -> None:
    unit.write(jobs="".join(f"ActiveState={state}\n" for state in ("activating", "active", "deactivating")))
    assert unit.prepare() == "prepare: a job of apt's own timers is at work, waiting for it\n"
    assert unit.calls("systemctl", "sleep") == [JOBS, "sleep 1"] * 3 + [JOBS]
    unit.write(jobs="ActiveState=active\n")
    assert unit.prepare() == "prepare: a job of apt's own timers is at work, waiting for it\n"
    for state in ("inactive", "failed"):
        unit.write(jobs=f"ActiveState={state}\n")
        assert unit.prepare() == ""


def test_job_that_hangs_does_not_keep_the_updater(unit: Unit) -> None:
    assert "apt_jobs_wait=600 #" in (unit.folder / "prepare").read_text()
    unit.change({"apt_jobs_wait=600 ": "apt_jobs_wait=3 "})
    unit.write(jobs="ActiveState=active\n" * 9)
    assert "prepare: it is at work after 3 s, going on beside it\n" in unit.prepare()
    assert len(unit.calls("sleep")) == 3


@pytest.mark.parametrize("state", ["iH ", "iU ", "iF ", "iW ", "it ", "iiR"])
def test_unfinished_state_is_repaired(unit: Unit, state: str) -> None:
    unit.environment["MENDED"] = "dpkg --configure"
    unit.write(packages=f"ii other\n{state}solvik4-rh\n")
    said = "prepare: an installation was broken off: solvik4-rh \nprepare: the installation is finished\n"
    assert unit.prepare() == said
    assert unit.repairs() == [STOP, CONFIGURE]


def test_steps_that_dpkg_has_noted_are_finished(unit: Unit) -> None:
    unit.environment["MENDED"] = "dpkg --configure"
    (unit.folder / "updates/0001").touch()
    assert "prepare: the installation is finished\n" in unit.prepare()
    assert unit.repairs() == [STOP, CONFIGURE]


@pytest.mark.parametrize(
    "mended, tried",
    [
        (MEND, [STOP, CONFIGURE, TAKE_OVER, REFRESH, POLICY, MEND]),
        (REINSTALL, [STOP, CONFIGURE, TAKE_OVER, REFRESH, POLICY, MEND, POLICY, f"{REINSTALL} solvik4-rh"]),
    ],
    ids=["mend", "reinstall"],
)
def test_steps_are_tried_until_one_helps(unit: Unit, mended: str, tried: list[str]) -> None:
    unit.environment["MENDED"] = mended
    unit.write(packages=BROKEN)
    unit.offer("1.2.0")
    assert "prepare: the installation is finished\n" in unit.prepare()
    assert unit.repairs() == tried
    assert (unit.folder / "selections").read_text() == ""


def test_package_of_which_another_version_is_offered_is_left_to_the_updater(unit: Unit) -> None:
    unit.write(packages=BROKEN)
    assert "prepare: still unfinished, left to the updater: solvik4-rh \n" in unit.prepare()
    assert unit.repairs() == [STOP, CONFIGURE, TAKE_OVER, REFRESH, POLICY, POLICY]


def test_broken_package_that_looks_up_to_date_keeps_the_updater_from_running(unit: Unit) -> None:
    unit.write(packages=BROKEN)
    unit.offer("1.2.0")
    wrong = "solvik4-rh cannot be finished and no other version of it is offered: the updater is not run"
    assert unit.prepare(status=1).splitlines()[1:] == [f"prepare: {wrong}"]


def test_other_packages_are_repaired_beside_it(unit: Unit) -> None:
    unit.write(packages=f"{BROKEN}iU solvik4-rh-data\niU other\n")
    said = unit.prepare()
    assert "prepare: an installation was broken off: solvik4-rh solvik4-rh-data other \n" in said
    assert "left to the updater: solvik4-rh solvik4-rh-data other \n" in said
    assert unit.repairs()[4:7] == [MEND, POLICY, f"{REINSTALL} solvik4-rh-data other"]
    unit.offer("1.2.0")
    unit.prepare(status=1)
    assert unit.calls("apt-get")[-1] == f"{REINSTALL} solvik4-rh solvik4-rh-data other"
    unit.environment |= {"MENDED": MEND, "LEFT": BROKEN}
    unit.prepare(status=1)
    assert unit.calls("apt-get")[-1] == f"{REINSTALL} solvik4-rh"


def test_other_package_that_stays_broken_does_not_keep_the_updater(unit: Unit) -> None:
    unit.write(packages="ii solvik4-rh\niU other\n")
    unit.offer("1.2.0")
    assert re.search("left to the updater: other \n$", unit.prepare())
    assert unit.repairs() == [STOP, CONFIGURE, TAKE_OVER, REFRESH, MEND, f"{REINSTALL} other"]
