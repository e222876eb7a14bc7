#!/usr/bin/env bash
# Times the platform key manager against a fresh swtpm.
#   bench/pcp_bench.sh [BUILD_DIR] [N]     (defaults: build, 7)
# The build must have BUILD_TESTING on; the swtpm is started at the build's
# TPM socket through the test fixture and stopped again on exit.
set -euo pipefail
here=$(cd "$(dirname "$0")" && pwd)
build=${1:-build}
rounds=${2:-7}
bench=$build/bench/pcp_bench
[ -x "$bench" ] || { echo "no $bench: build with BUILD_TESTING on first" >&2; exit 1; }
tcti=$("$bench" --tcti)
"$here/../scripts/swtpm-fixture.sh" start "$tcti" >/dev/null
trap '"$here/../scripts/swtpm-fixture.sh" stop "$tcti" >/dev/null' EXIT
"$bench" "$rounds"
