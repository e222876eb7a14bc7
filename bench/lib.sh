# shellcheck shell=bash
# Shared by the benchmark scripts: sourced, not run.

# build_setting BUILD_DIR NAME prints a cache variable of a configured build.
build_setting() {
  sed -n "s/^$2:[A-Z]*=//p" "$1/CMakeCache.txt"
}

# wall_ms CMD...: runs CMD once (it must succeed, output discarded) and
# prints its wall time in milliseconds.
wall_ms() {
  # The clock in microseconds, read without starting a process.
  local start=${EPOCHREALTIME/[.,]/} end
  "$@" >/dev/null || { echo "failed: $*" >&2; exit 1; }
  end=${EPOCHREALTIME/[.,]/}
  awk -v us=$((end - start)) 'BEGIN { printf "%.3f\n", us / 1000 }'
}

# median prints the median of the numbers on standard input, one a line.
median() {
  sort -g | awk '{ t[NR] = $1 } END { print t[int((NR + 1) / 2)] }'
}

# median_of "N N ...": the median of a space-separated list of numbers.
median_of() {
  local -a values
  read -ra values <<<"$1"
  printf '%s\n' "${values[@]}" | median
}

# median_ms RUNS CMD...: the median of RUNS runs of wall_ms CMD.
median_ms() {
  local runs=$1
  shift
  for _ in $(seq "$runs"); do
    wall_ms "$@"
  done | median
}

# peak_mib CMD...: runs CMD once under /usr/bin/time and prints its peak
# resident memory in MiB.
peak_mib() {
  # time writes to standard error; the command's output is discarded.
  /usr/bin/time -f "%M" "$@" 2>&1 >/dev/null | tail -n 1 |
    awk '{ printf "%.1f\n", $1 / 1024 }'
}
