"""What the operator sees and hears at the end of an update of the remote head."""

from dataclasses import dataclass


@dataclass(frozen=True)
class Outcome:
    """One outcome of an update."""

    leds: tuple[str, ...]  # that are lit, by name
    color: str
    sound: str  # "pass", "fail" or "", see SOUND_FILES
    meaning: str

    @property
    def panel(self) -> dict[str, str]:
        """The LEDs that are lit, by name, with the names of their colours."""
        return dict.fromkeys(self.leds, self.color)


SOUND_FILES = {"pass": "SND_RESULT_PASS.wav", "fail": "SND_RESULT_FAIL.wav"}

UP_TO_DATE = Outcome(("REMOTE", "MAIN"), "pass", "pass", "nothing to update")
UPDATED = Outcome(("PASS",), "pass", "pass", "updated")
CHECK_FAILED = Outcome(("REMOTE", "MAIN"), "fail", "fail", "the mirrors or a version could not be read")
INSTALLATION_FAILED = Outcome(("FAIL",), "fail", "fail", "the package or the board could not be installed")
OUTCOMES = [UP_TO_DATE, UPDATED, CHECK_FAILED, INSTALLATION_FAILED]  # that the updater shows
ENDED_EARLY = Outcome(("FAIL",), "fail", "", "the update ended before its outcome was known")  # shown by the service


def meaning_of(panel: dict[str, str]) -> str:
    """What the updater says with the LEDs `panel`, in words."""
    found = [outcome.meaning for outcome in OUTCOMES if outcome.panel == panel]
    return found[0] if found else "the panel shows no outcome"
