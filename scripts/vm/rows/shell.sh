#!/bin/sh
# shellcheck shell=dash
# For a boot by hand: the boot script (in a boot through the firmware, the
# measured integration has proved the boot instead), then a shell on the
# console. The checks of a row run again with sh /usr/lib/vmtest/rows/ROW.sh.
# shellcheck source=scripts/vm/lib.sh
. /usr/lib/vmtest/lib.sh

if [ -z "${vmtest_chain:-}" ]; then
  run_boot_script
  echo "boot script exit status $boot_status"
fi
echo "$log holds:"
cat "$log" 2>/dev/null
echo "exit the shell to power off"
setsid cttyhack sh
