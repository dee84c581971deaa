#!/usr/bin/env bash
# Installs what is missing, then builds and runs every test three times: a plain optimised build,
# an AddressSanitizer+UndefinedBehaviorSanitizer build and a ThreadSanitizer build. Warnings are
# errors in all three. Pass build names (release, asan, tsan) to run only those.
set -euo pipefail
cd "$(dirname "$0")/.."
./scripts/bootstrap.sh

export ASAN_OPTIONS="detect_leaks=1:abort_on_error=1:strict_string_checks=1"
export UBSAN_OPTIONS="print_stacktrace=1:halt_on_error=1"
export TSAN_OPTIONS="halt_on_error=1:second_deadlock_stack=1"

# Rebuilds of unchanged sources come from ccache (keyed on paths relative to the checkout, so
# another clone of the same tree hits too); a cold cache only makes the first run slower.
launcher=()
if command -v ccache >/dev/null; then
  export CCACHE_BASEDIR="$PWD" CCACHE_NOHASHDIR=1 CCACHE_MAXSIZE=5G
  launcher=(-DCMAKE_CXX_COMPILER_LAUNCHER=ccache)
fi

run_build() {
  local name=$1
  shift
  local dir="build/$name"
  echo "== $name build"
  cmake -S . -B "$dir" -G Ninja -DTAVRIN_WERROR=ON "${launcher[@]}" "$@" >/dev/null
  ninja -C "$dir"
  echo "== $name tests"
  ctest --test-dir "$dir" --output-on-failure --timeout 600 -j "$(nproc)"
}

# Formatting is checked before anything is built: clang-format with the repo's .clang-format, on
# every tracked C and C++ source.
echo "== format check"
git ls-files -z '*.c' '*.cc' '*.cpp' '*.h' '*.hpp' | xargs -0 clang-format --dry-run --Werror

builds=("$@")
[ ${#builds[@]} -gt 0 ] || builds=(release asan tsan)
for build in "${builds[@]}"; do
  case "$build" in
    release) run_build release -DCMAKE_BUILD_TYPE=RelWithDebInfo ;;
    asan) run_build asan -DCMAKE_BUILD_TYPE=Debug -DTAVRIN_SANITIZE=address -DTAVRIN_BUILD_BENCH=OFF ;;
    tsan) run_build tsan -DCMAKE_BUILD_TYPE=Debug -DTAVRIN_SANITIZE=thread -DTAVRIN_BUILD_BENCH=OFF ;;
    *) echo "unknown build '$build' (release, asan, tsan)" >&2; exit 2 ;;
  esac
done
