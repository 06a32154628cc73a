#!/usr/bin/env bash
# The main job: builds tidelink if needed, then opens the bundled example project in the reference
# compositing peer through the link manager, lists it, and renders frames and audio of its demo
# composition into demo-output/ (PNG files and a WAV file).
#   scripts/demo.sh [output folder]
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/install-deps.sh
# Let ccache share results between clones of the project.
export CCACHE_BASEDIR="$PWD" CCACHE_NOHASHDIR=1
if [ ! -x build/release/bin/tidelink ] || [ ! -x build/release/bin/tidelinkpeer ] ||
   [ -n "$(find CMakeLists.txt apps platform tidelink processcoordination -newer build/release/bin/tidelink -print -quit 2>/dev/null)" ]; then
  echo "== building (release)" >&2
  cmake --preset release >/dev/null
  cmake --build --preset release -j "$(nproc)"
fi
# A link manager this demo starts leaves by itself soon after the demo ends, and its peers with it.
export TIDELINK_MANAGER_IDLE_EXIT="${TIDELINK_MANAGER_IDLE_EXIT:-10}"
out="${1:-demo-output}"
project=examples/projects/demo.kstproj
item="Compositions/Demo 1080p29.97"
tl=build/release/bin/tidelink
rm -rf "$out/frames" "$out/demo.wav"
mkdir -p "$out/frames"

echo "== tidelink status" >&2
$tl status
echo "== tidelink open $project" >&2
$tl open "$project"
echo "== tidelink items $project" >&2
$tl items "$project"
echo "== tidelink describe $project \"$item\"" >&2
$tl describe "$project" "$item"
echo "== tidelink render: 60 frames (2 seconds) of \"$item\"" >&2
$tl render "$project" "$item" --frames 0-59 -o "$out/frames/frame_%05d.png"
echo "== tidelink audio: 2 seconds of \"$item\"" >&2
$tl audio "$project" "$item" --start 0 --duration 2 -o "$out/demo.wav"
echo
echo "Frames: $(cd "$out/frames" && pwd)/frame_00000.png ... frame_00059.png"
echo "Audio:  $(cd "$out" && pwd)/demo.wav (440 Hz left, 1 kHz right)"
