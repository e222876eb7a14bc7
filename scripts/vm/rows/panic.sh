#!/bin/sh
# shellcheck shell=dash
# A kernel panic while the boot proof runs, after keymgr has logged.
# shellcheck source=scripts/vm/lib.sh
. /usr/lib/vmtest/lib.sh

proof_runs() { pidof kmm-host >/dev/null; }

/etc/init.d/keymgr-boot start >/dev/null 2>&1 &
n=0
until proof_runs || [ $n -ge 1000 ]; do
  n=$((n + 1))
  usleep 5000
done
check "kmm-host runs: panicking now" proof_runs
echo c >/proc/sysrq-trigger
