#!/usr/bin/env bash
# Runs every fuzz target for a longer time by hand: 10 minutes each unless
# DPX_FUZZ_SECONDS says otherwise. Builds them with clang's libFuzzer under
# AddressSanitizer and UndefinedBehaviorSanitizer in build-fuzz (or $1).
# Inputs that crash land in build-fuzz/tests/fuzz/artifacts; new inputs in
# build-fuzz/tests/fuzz/corpus, never in the committed seeds.
set -euo pipefail
cd "$(dirname "$0")/../.."
build=${1:-build-fuzz}
seconds=${DPX_FUZZ_SECONDS:-600}

CC=clang CXX=clang++ cmake -S . -B "$build" -DCMAKE_BUILD_TYPE=RelWithDebInfo -DDPX_SANITIZE=ON \
  -DDPX_BUILD_JAVA=OFF -DDPX_BUILD_BENCH=OFF -DDPX_FUZZ_SECONDS="$seconds" \
  -DCMAKE_C_FLAGS=-fsanitize=fuzzer-no-link -DCMAKE_CXX_FLAGS=-fsanitize=fuzzer-no-link >/dev/null
targets=$(cd tests/fuzz && ls *_fuzz.cc | sed 's/\.cc$//')
# shellcheck disable=SC2086
cmake --build "$build" -j"${DPX_JOBS:-2}" --target $targets
UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
  ctest --test-dir "$build" -L fuzz --output-on-failure
