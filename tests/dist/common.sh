# shellcheck shell=bash
# The dist tests' start, sourced as: . common.sh NAME BUILD_DIR [EMULATOR...]
# It sets build (BUILD_DIR, absolute), emulator (the words that start a program
# of the build: none in a native build) and work (BUILD_DIR/NAME, emptied), and
# defines fail.
build=$(cd "$2" && pwd)
# shellcheck disable=SC2034 # read by the tests that source this
emulator=("${@:3}")
work=$build/$1
rm -rf "$work"
mkdir -p "$work"
fail() {
  echo "$(basename "$0"): $*" >&2
  exit 1
}
