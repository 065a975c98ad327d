#!/usr/bin/env bash
# Prints the tests-to-code ratio: non-blank lines of .cpp and .h files under
# tests/ over those under foundation/ zip/ xar/ applefile/ tools/ include/.
# Exits 1 when the ratio is above the threshold, so the suite stays in proportion.
#
# Usage: scripts/test-ratio.sh [THRESHOLD]   (default 0.45)
set -euo pipefail
cd "$(dirname "$0")/.."
threshold=${1:-0.45}

nonblank() {
    find "$@" -type f \( -name '*.cpp' -o -name '*.h' \) -print0 |
        xargs -0 -r cat | grep -c '[^[:space:]]' || true
}

tests=$(nonblank tests)
code=$(nonblank foundation zip xar applefile tools include)
awk -v tests="$tests" -v code="$code" -v limit="$threshold" 'BEGIN {
    ratio = code > 0 ? tests / code : 0
    printf "tests/code: %d / %d non-blank lines = %.2f (limit %.2f)\n", tests, code, ratio, limit
    exit ratio > limit ? 1 : 0
}'
