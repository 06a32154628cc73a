#!/usr/bin/env bash
# Fails when a link manager started by the test suite still runs, or when shared memory of a test
# suite version (9xxxxx) is left in /dev/shm.
set -u
status=0
for exe in /proc/[0-9]*/exe; do
  pid=${exe#/proc/}; pid=${pid%/exe}
  target=$(readlink "$exe" 2>/dev/null) || continue
  case "${target% (deleted)}" in */tidelinkmanager) ;; *) continue ;; esac
  if tr '\0' '\n' < "/proc/$pid/environ" 2>/dev/null | grep -qx 'TIDELINK_TEST_SUITE=1'; then
    echo "left running: tidelinkmanager pid $pid"
    status=1
  fi
done
left=$(ls /dev/shm 2>/dev/null | grep -E '^(tlm|tidelink)' | grep -E '9[0-9]{5}\.0(\(Beta\))?$|^tidelink-test-' || true)
if [ -n "$left" ]; then
  echo "left in /dev/shm:"; echo "$left"
  status=1
fi
[ $status -eq 0 ] && echo "no process or shared memory of the tests left behind"
exit $status
