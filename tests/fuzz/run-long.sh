#!/usr/bin/env bash
# Runs every fuzz target under libFuzzer, AddressSanitizer and UBSan for
# DPX_FUZZ_SECONDS each (default 10 minutes), built with clang in
# build-fuzz (or $1). Crashing inputs land in <build>/tests/fuzz/artifacts,
# new inputs in <build>/tests/fuzz/corpus, never in the committed seeds.
set -euo pipefail
cd "$(dirname "$0")/../.."
build=${1:-build-fuzz}
seconds=${DPX_FUZZ_SECONDS:-600}

CC=clang CXX=clang++ cmake -S . -B "$build" -DCMAKE_BUILD_TYPE=RelWithDebInfo -DDPX_SANITIZE=ON \
  -DDPX_BUILD_JAVA=OFF -DDPX_BUILD_BENCH=OFF -DDPX_FUZZ_SECONDS="$seconds" \
  -DCMAKE_C_FLAGS=-fsanitize=fuzzer-no-link -DCMAKE_CXX_FLAGS=-fsanitize=fuzzer-no-link >/dev/null
# shellcheck disable=SC2046
cmake --build "$build" -j"${DPX_JOBS:-2}" --target $(cd tests/fuzz && ls *_fuzz.cc | sed 's/\.cc$//')
UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 ctest --test-dir "$build" -L fuzz --output-on-failure
