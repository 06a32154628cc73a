#!/usr/bin/env bash
# Builds and runs the whole test suite. Presets: debug (default), asan, tsan.
#   scripts/test.sh              debug build, every test
#   scripts/test.sh debug asan   both, one after the other
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/install-deps.sh
# Let ccache share results between clones of the project.
export CCACHE_BASEDIR="$PWD" CCACHE_NOHASHDIR=1
presets=("$@")
[ ${#presets[@]} -eq 0 ] && presets=(debug)
for preset in "${presets[@]}"; do
  echo "== $preset: configure and build" >&2
  cmake --preset "$preset" >/dev/null
  cmake --build --preset "$preset" -j "$(nproc)"
  echo "== $preset: test" >&2
  if [ "$preset" = debug ]; then
    ctest --preset all
  else
    ctest --preset "$preset"
  fi
done
