#!/usr/bin/env bash
# The main job: builds tidelink if needed, then reaches the link manager (starting it) and
# describes it.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/install-deps.sh
# Let ccache share results between clones of the project.
export CCACHE_BASEDIR="$PWD" CCACHE_NOHASHDIR=1
if [ ! -x build/release/bin/tidelink ] || [ -n "$(find CMakeLists.txt apps platform tidelink -newer build/release/bin/tidelink -print -quit 2>/dev/null)" ]; then
  echo "== building (release)" >&2
  cmake --preset release >/dev/null
  cmake --build --preset release -j "$(nproc)"
fi
# A link manager this demo starts leaves by itself soon after the demo ends.
export TIDELINK_MANAGER_IDLE_EXIT="${TIDELINK_MANAGER_IDLE_EXIT:-10}"
echo "== tidelink status" >&2
build/release/bin/tidelink status "$@"
