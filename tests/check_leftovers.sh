#!/usr/bin/env bash
# Fails when a process of this test run still runs (a link manager, or anything it or a test
# started: peers inherit the run's TIDELINK_SUITE_VERSION), or when shared memory of it is left in
# /dev/shm. Each integration test process records its suite version in the folder given as $1;
# the records are consumed here.
set -u
records=${1:?record folder}
status=0
shopt -s nullglob
versions=()
for f in "$records"/*; do versions+=("$(basename "$f")"); done
for v in "${versions[@]}"; do
  for exe in /proc/[0-9]*/exe; do
    pid=${exe#/proc/}; pid=${pid%/exe}
    [ "$pid" = "$$" ] && continue
    target=$(readlink "$exe" 2>/dev/null) || continue
    if tr '\0' '\n' < "/proc/$pid/environ" 2>/dev/null | grep -qx "TIDELINK_SUITE_VERSION=$v"; then
      echo "left running: ${target##*/} pid $pid (suite version $v)"
      status=1
    fi
  done
  for name in /dev/shm/*"$v".0 /dev/shm/*"$v".0\(Beta\); do
    echo "left in /dev/shm: ${name#/dev/shm/}"
    status=1
  done
done
for name in /dev/shm/tidelink-test-*; do
  echo "left in /dev/shm: ${name#/dev/shm/}"
  status=1
done
rm -f "$records"/*
[ $status -eq 0 ] && echo "no process or shared memory of the ${#versions[@]} test processes left behind"
exit $status
