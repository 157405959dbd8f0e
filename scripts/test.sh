#!/usr/bin/env bash
# Builds everything and runs the whole suite twice: a normal build, then one
# with AddressSanitizer and UndefinedBehaviorSanitizer; runs the fault and load
# suites once more under ThreadSanitizer; then, where clang is installed, runs
# each fuzz target for a few seconds under libFuzzer.
set -euo pipefail
cd "$(dirname "$0")/.."
bash scripts/deps.sh

jobs=${DPX_JOBS:-2}

echo "== normal build"
cmake -S . -B build -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
# A warning of the compiler or the linker fails the run: the build starts
# clean and stays so.
cmake --build build -j"$jobs" 2>&1 | tee build/build.log
if grep -iE '(^|[^a-z])warning:' build/build.log; then
  echo "the build printed the warnings above" >&2
  exit 1
fi
ctest --test-dir build --output-on-failure -j"$jobs" --timeout 900

echo "== AddressSanitizer + UndefinedBehaviorSanitizer build"
# The JVM can't load an ASan library without preloading the runtime, so the
# Java bridge is tested in the normal build only; the slow long-file cases
# also stay there.
cmake -S . -B build-asan -DCMAKE_BUILD_TYPE=Debug -DDPX_SANITIZE=ON -DDPX_BUILD_JAVA=OFF -DDPX_BUILD_BENCH=OFF >/dev/null
cmake --build build-asan -j"$jobs"
ASAN_OPTIONS=detect_leaks=1:abort_on_error=0 UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
  DPX_SKIP_SLOW=1 ctest --test-dir build-asan --output-on-failure -j"$jobs" --timeout 900

echo "== ThreadSanitizer build: fault and load suites"
# The daemon and the dpx program these suites start are built with it too; a
# report in the daemon fails its exit status. Verbose, so that the suites'
# summaries (faults tried, transfers verified, bytes moved) show in the log.
cmake -S . -B build-tsan -DCMAKE_BUILD_TYPE=RelWithDebInfo -DDPX_SANITIZE_THREAD=ON -DDPX_BUILD_JAVA=OFF \
  -DDPX_BUILD_BENCH=OFF >/dev/null
cmake --build build-tsan -j"$jobs" --target faults_test load_test
TSAN_OPTIONS=halt_on_error=1 DPX_SKIP_SLOW=1 \
  ctest --test-dir build-tsan --verbose -R '^(Faults|Load)\.' --timeout 900

if command -v clang++ >/dev/null; then
  echo "== fuzz targets (clang, libFuzzer, a few seconds each)"
  DPX_FUZZ_SECONDS=10 bash tests/fuzz/run-long.sh build-fuzz
fi
