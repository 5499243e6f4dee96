"""Stand-ins for i2cset of i2c-tools before 4.2, and since: the newer ones accept the panel's address only with -a.

Lines of shell that check the arguments; the lines after them get the arguments without -a.
"""

UNKNOWN = 'echo "Error: Unsupported option \\"$1\\"!" >&2; echo "Usage: i2cset [-f] [-y] [-m MASK] [-r] {}" >&2; exit 1'
ARGUMENTS = "I2CBUS CHIP-ADDRESS DATA-ADDRESS [VALUE]"
OLDER = f"""case $1 in
-y) ;;
*) {UNKNOWN.format(ARGUMENTS)} ;;
esac
"""
NEWER = f"""case $1 in
-a) shift ;;
-y) echo "Error: Chip address out of range (0x08-0x77)!" >&2; exit 1 ;;
*) {UNKNOWN.format("[-a] " + ARGUMENTS)} ;;
esac
"""
