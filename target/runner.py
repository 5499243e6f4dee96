"""Runs scenarios on the emulated unit, those of one boot one after the other, and reads the result of each."""

from dataclasses import dataclass
from pathlib import Path

from bench.panel import panel_after
from target.check import check, check_cut
from target.evidence import Evidence, read, read_bus
from target.inputs import write_input
from target.machine import MachineError, boot, copy_disk
from target.plan import Plan

WORK = Path(__file__).parent.parent / "build/target"
SCENARIO_LIMIT = 1800  # s, for one scenario without the updater's waits; guest/main gives up earlier
SLOWNESS = 5  # how many times longer than by the unit's clock a wait with flashing may take

Results = dict[str, tuple[Evidence, list[str]]]  # the result of each scenario, and its differences


@dataclass
class Emulation:
    """The settings that all boots share."""

    image: Path  # folder with the disk and the boot files
    updater: Path  # package
    speed: float  # how many times shorter the updater's waits are

    def write_input(self, plans: list[Plan], again: bool = False) -> Path:
        """Writes the disk with `plans` for the unit. `again`: the run after a power cut."""
        inputs = WORK / "in.tar"
        write_input(inputs, WORK / "in", self.image, self.updater, plans, self.speed, again)
        return inputs

    def boot(
        self,
        inputs: Path,
        plans: list[Plan],
        folder: Path,
        disk: Path | None = None,
        cut: bool = False,
        copies: list[Path] | None = None,
    ) -> None:
        """Boots a unit with the `inputs` for `plans` and waits for the end; `folder` then holds the results.

        @param disk  the unit's disk; none: that of the image, which stays unchanged
        The rest is as in machine.boot. Raises MachineError.
        """
        limit = sum(SCENARIO_LIMIT + SLOWNESS * sum(plan.like.expect.waits) / self.speed for plan in plans)
        kept = disk is not None
        boot(self.image, disk or self.image / "root.ext4", inputs, folder, limit, kept, cut, copies)

    def run_shared(self, plans: list[Plan]) -> Results:
        """Runs `plans` one after the other in one boot. Raises MachineError."""
        folder = WORK / "shared"
        self.boot(self.write_input(plans), plans, folder)
        return {plan.name: (left, check(plan, left)) for plan, left in zip(plans, read_all(plans, folder))}

    def run_cut(self, plan: Plan) -> Results:
        """Runs `plan` until it stops the machine hard, boots the same disk again and runs the update.

        Raises MachineError.
        """
        folder, disk = WORK / plan.name, WORK / "disk.ext4"
        copy_disk(self.image / "root.ext4", disk)
        try:
            self.boot(self.write_input([plan]), [plan], WORK / f"{plan.name}-cut", disk, cut=True)
            self.boot(self.write_input([plan], again=True), [plan], folder, disk)
        finally:
            disk.unlink(missing_ok=True)
        panel = panel_after(read_bus(WORK / f"{plan.name}-cut/bus")[-1])
        [evidence] = read_all([plan], folder)
        return {plan.name: (evidence, check_cut(plan, panel, evidence) + check(plan, evidence))}


def read_all(plans: list[Plan], folder: Path) -> list[Evidence]:
    """Reads the results of a boot with `plans` from `folder`. Raises MachineError."""
    parts = read_bus(folder / "bus")
    if len(parts) != 2 * len(plans) + 1:
        raise MachineError(f"{len(parts) - 1} marks on the I2C bus for {len(plans)} scenarios: see {folder / 'bus'}")
    return [read(folder / plan.name, parts[2 * index + 1]) for index, plan in enumerate(plans)]
