#!/usr/bin/env bash
# Builds codec_bench without sanitizers in Release and runs it: AAC encode and decode
# through our converter layer beside ffmpeg's own, on the same 60 s of PCM.
# Usage: bench/codec_bench.sh [BUILD_DIR] [ROUNDS]
set -euo pipefail

root="$(cd "$(dirname "$0")/.." && pwd)"
build="${1:-$root/build-bench}"
rounds="${2:-3}"

"$root/scripts/setup"
cmake -S "$root" -B "$build" -DCMAKE_BUILD_TYPE=Release -DTQOVIX_SANITIZE= -DTQOVIX_BUILD_TESTS=OFF \
  -DTQOVIX_BUILD_BENCH=ON >/dev/null
cmake --build "$build" -j2 --target codec_bench
"$build/bench/codec_bench" "" "$rounds"
