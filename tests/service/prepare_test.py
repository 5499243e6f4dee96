"""prepare, which runs before the updater, on stand-in tools."""

import re
import subprocess
import unittest

from tests.service.stand_in import StandInTest

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


class Prepare(StandInTest):
    """A unit on which nothing is broken, with a stick that nobody has to verify."""

    program = "prepare"
    tools = TOOLS
    changes = CHANGES

    def setUp(self) -> None:
        super().setUp()
        self.environment |= {"MENDED": "nothing", "LEFT": "ii solvik4-rh"}
        (self.unit / "updates").mkdir()
        self.write(packages="ii solvik4-rh\nrc solvik4-old\nun other\nhi held\n", jobs="", wrong="")
        self.offer("1.3.0")

    def write(self, **texts: str) -> None:
        for name, text in texts.items():
            (self.unit / name).write_text(text)

    def offer(self, candidate: str) -> None:
        self.write(policy=f"solvik4-rh:\n  Installed: 1.2.0\n  Candidate: {candidate}\n  Version table:\n")

    def prepare(self, status: int = 0) -> str:
        """Runs it; returns its output."""
        done = subprocess.run(
            [self.unit / "prepare"],
            env=self.environment,
            stdin=subprocess.DEVNULL,
            capture_output=True,
            text=True,
            check=False,
            timeout=60,
        )
        self.assertEqual((done.stderr, done.returncode), ("", status))
        return done.stdout

    def repairs(self) -> list[str]:
        """The calls that change something, or find out what would."""
        return [call for call in self.calls("dpkg", "apt-get", "apt-cache", "systemctl") if call != JOBS]

    def test_notes_of_the_run_begin(self) -> None:
        (self.unit / "run/select").touch()
        (self.unit / "run/give-back").mkdir()
        self.assertEqual(self.prepare(), "")
        files = {path.name: path.read_text() for path in (self.unit / "run").iterdir()}
        self.assertRegex(files.pop("notes"), r"^\d+\.\d\d prepared\n$")
        last = '#include "/usr/lib/harl-updater/apt-last.conf";\n'
        self.assertEqual(files, {"cursor": "s=1;i=2\n", "apt.conf": last})
        self.assertEqual(self.calls(), ["journalctl --identifier=harl-updater --show-cursor --lines=0", JOBS])
        self.write(**{"apt.conf": ""})
        self.prepare()
        self.assertEqual((self.unit / "run/apt.conf").read_text(), f'#include "/etc/apt/apt.conf";\n{last}')

    def test_stick_is_verified_where_a_keyring_is_installed(self) -> None:
        for target in ("/dev/null", "/nowhere"):
            (self.unit / "keyring").symlink_to(target)
            self.assertEqual(self.prepare(), "")
            self.assertEqual(self.calls("verify-stick"), [f"verify-stick /root/USB_MOUNT {self.unit}/keyring"])
            path = self.environment["PATH"]
            self.assertEqual((self.unit / "path").read_text(), f"{path}:/usr/lib/harl-updater\n")
            self.setUp()

    def test_stick_that_is_not_the_makers_keeps_the_updater_from_running(self) -> None:
        for wrong, said in (("changed: x\nadded: y\n", ("changed: x", "added: y")), ("", ("it cannot be read",))):
            self.write(keyring="", wrong=wrong, packages=BROKEN, jobs="ActiveState=active\n")
            with (self.unit / "bin/verify-stick").open("a") as tool:
                tool.write("exit 1\n")
            lines = [f"prepare: the stick is not as the maker signed it: {what}\n" for what in said]
            self.assertEqual(self.prepare(status=1), "".join(lines) + "prepare: the updater is not run\n")
            self.assertEqual(self.calls("systemctl", "dpkg", "apt-get"), [])
            self.assertTrue((self.unit / "run/notes").exists())
            self.setUp()

    def test_jobs_of_apts_own_timers_are_waited_for(self) -> None:
        self.write(jobs="".join(f"ActiveState={state}\n" for state in ("activating", "active", "deactivating")))
        self.assertEqual(self.prepare(), "prepare: a job of apt's own timers is at work, waiting for it\n")
        self.assertEqual(self.calls("systemctl", "sleep"), [JOBS, "sleep 1"] * 3 + [JOBS])
        self.write(jobs="ActiveState=active\n")
        self.assertEqual(self.prepare(), "prepare: a job of apt's own timers is at work, waiting for it\n")
        for state in ("inactive", "failed"):
            self.write(jobs=f"ActiveState={state}\n")
            self.assertEqual(self.prepare(), "")

    def test_job_that_hangs_does_not_keep_the_updater(self) -> None:
        self.assertIn("apt_jobs_wait=600 #", (self.unit / "prepare").read_text())
        self.change({"apt_jobs_wait=600 ": "apt_jobs_wait=3 "})
        self.write(jobs="ActiveState=active\n" * 9)
        self.assertIn("prepare: it is at work after 3 s, going on beside it\n", self.prepare())
        self.assertEqual(len(self.calls("sleep")), 3)

    def test_each_unfinished_state_is_repaired(self) -> None:
        self.environment["MENDED"] = "dpkg --configure"
        for state in ("iH ", "iU ", "iF ", "iW ", "it ", "iiR"):
            with self.subTest(state=state):
                self.write(packages=f"ii other\n{state}solvik4-rh\n")
                said = "prepare: an installation was broken off: solvik4-rh \nprepare: the installation is finished\n"
                self.assertEqual(self.prepare(), said)
                self.assertEqual(self.repairs(), [STOP, CONFIGURE])
            self.setUp()
            self.environment["MENDED"] = "dpkg --configure"

    def test_steps_that_dpkg_has_noted_are_finished(self) -> None:
        self.environment["MENDED"] = "dpkg --configure"
        (self.unit / "updates/0001").touch()
        self.assertIn("prepare: the installation is finished\n", self.prepare())
        self.assertEqual(self.repairs(), [STOP, CONFIGURE])

    def test_steps_are_tried_until_one_helps(self) -> None:
        for mended, tried in (
            (MEND, [STOP, CONFIGURE, TAKE_OVER, REFRESH, POLICY, MEND]),
            (REINSTALL, [STOP, CONFIGURE, TAKE_OVER, REFRESH, POLICY, MEND, POLICY, f"{REINSTALL} solvik4-rh"]),
        ):
            self.environment["MENDED"] = mended
            self.write(packages=BROKEN)
            self.offer("1.2.0")
            self.assertIn("prepare: the installation is finished\n", self.prepare())
            self.assertEqual(self.repairs(), tried)
            self.assertEqual((self.unit / "selections").read_text(), "")
            self.setUp()

    def test_package_of_which_another_version_is_offered_is_left_to_the_updater(self) -> None:
        self.write(packages=BROKEN)
        self.assertIn("prepare: still unfinished, left to the updater: solvik4-rh \n", self.prepare())
        self.assertEqual(self.repairs(), [STOP, CONFIGURE, TAKE_OVER, REFRESH, POLICY, POLICY])

    def test_broken_package_that_looks_up_to_date_keeps_the_updater_from_running(self) -> None:
        self.write(packages=BROKEN)
        self.offer("1.2.0")
        wrong = "solvik4-rh cannot be finished and no other version of it is offered: the updater is not run"
        self.assertEqual(self.prepare(status=1).splitlines()[1:], [f"prepare: {wrong}"])

    def test_other_packages_are_repaired_beside_it(self) -> None:
        self.write(packages=f"{BROKEN}iU solvik4-rh-data\niU other\n")
        said = self.prepare()
        self.assertIn("prepare: an installation was broken off: solvik4-rh solvik4-rh-data other \n", said)
        self.assertIn("left to the updater: solvik4-rh solvik4-rh-data other \n", said)
        self.assertEqual(self.repairs()[4:7], [MEND, POLICY, f"{REINSTALL} solvik4-rh-data other"])
        self.offer("1.2.0")
        self.prepare(status=1)
        self.assertEqual(self.calls("apt-get")[-1], f"{REINSTALL} solvik4-rh solvik4-rh-data other")
        self.environment |= {"MENDED": MEND, "LEFT": BROKEN}
        self.prepare(status=1)
        self.assertEqual(self.calls("apt-get")[-1], f"{REINSTALL} solvik4-rh")

    def test_other_package_that_stays_broken_does_not_keep_the_updater(self) -> None:
        self.write(packages="ii solvik4-rh\niU other\n")
        self.offer("1.2.0")
        self.assertTrue(re.search("left to the updater: other \n$", self.prepare()))
        self.assertEqual(self.repairs(), [STOP, CONFIGURE, TAKE_OVER, REFRESH, MEND, f"{REINSTALL} other"])


if __name__ == "__main__":
    unittest.main()
