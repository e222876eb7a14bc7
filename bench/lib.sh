# Shared by the benchmark scripts: sourced, not run.

# build_setting BUILD_DIR NAME prints a cache variable of a configured build.
build_setting() {
  sed -n "s/^$2:[A-Z]*=//p" "$1/CMakeCache.txt"
}

# median_ms RUNS CMD...: runs CMD RUNS times (it must succeed, output
# discarded) and prints the median wall time in milliseconds.
median_ms() {
  local runs=$1 times=() start end
  shift
  for _ in $(seq "$runs"); do
    start=$(date +%s%N)
    "$@" >/dev/null || { echo "failed: $*" >&2; exit 1; }
    end=$(date +%s%N)
    times+=($(( (end - start) / 1000 )))
  done
  printf '%s\n' "${times[@]}" | sort -n |
    awk '{ t[NR] = $1 } END { printf "%.1f\n", t[int((NR + 1) / 2)] / 1000 }'
}
