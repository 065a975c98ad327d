#!/usr/bin/env bash
# Runs one fuzz target for SECONDS on its corpus, building the targets (with
# clang 14) and writing the seed corpora first when needed.
#
#     scripts/fuzz.sh fuzz_zip_archive 60
#
# The corpus grows in $BUILD/fuzz/corpus/TARGET; the seeds the test builders
# make are rewritten into $BUILD/fuzz/seeds on every run. Crashing, leaking
# and slow inputs land in $BUILD/fuzz/findings/TARGET/; the exit status is
# non-zero when there are new ones. FUZZ_BUILD_DIR picks the build folder
# (default build-fuzz); extra arguments go to libFuzzer.
set -euo pipefail
cd "$(dirname "$0")/.."

if (($# < 2)); then
  echo "usage: scripts/fuzz.sh TARGET SECONDS [libFuzzer options...]" >&2
  exit 2
fi
target=$1
seconds=$2
shift 2
build=${FUZZ_BUILD_DIR:-build-fuzz}
jobs=${JOBS:-$(nproc)}

# Inputs longer than this add time, not reach: archives stay at 64 KiB, the
# extra-field list fits in a ZIP header's 16-bit length.
case "$target" in
  fuzz_zip_extra_fields) max_len=4096 ;;
  fuzz_xar_toc_entry) max_len=16384 ;;
  fuzz_*) max_len=65536 ;;
  *) echo "unknown fuzz target: $target" >&2; exit 2 ;;
esac

if [[ ! -f "$build/CMakeCache.txt" ]]; then
  CC=${CC:-clang-14} CXX=${CXX:-clang++-14} cmake -S . -B "$build" \
    -DCMAKE_BUILD_TYPE=RelWithDebInfo -DGW_FUZZ=ON >/dev/null
else
  cmake "$build" >/dev/null  # picks up targets added since the last configure
fi
cmake --build "$build" --parallel "$jobs" --target "$target" gwarchive_fuzz_seeds >/dev/null

fuzz="$build/fuzz"
"$fuzz/gwarchive_fuzz_seeds" "$fuzz/seeds"
mkdir -p "$fuzz/corpus/$target" "$fuzz/findings/$target" "$fuzz/tmp"

# Each target's scratch files stay in the build tree; leaks are findings. One
# input runs in milliseconds; the timeout is loose only because a loaded
# shared machine can stall a process for seconds.
TMPDIR="$(cd "$fuzz/tmp" && pwd)" \
ASAN_OPTIONS=${ASAN_OPTIONS:-detect_leaks=1} \
UBSAN_OPTIONS=${UBSAN_OPTIONS:-print_stacktrace=1:halt_on_error=1} \
  "$fuzz/$target" -max_total_time="$seconds" -max_len="$max_len" -timeout=30 \
  -rss_limit_mb=2048 -print_final_stats=1 \
  -artifact_prefix="$fuzz/findings/$target/" "$@" \
  "$fuzz/corpus/$target" "$fuzz/seeds/$target"
