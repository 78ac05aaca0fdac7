#!/usr/bin/env bash
# SPDX-License-Identifier: Apache-2.0
# make soak: kestreld's long run (scripts/soak.sh [build-dir]). Runs kestrel-soak in a network
# namespace of its own, twice: the full soak (one million sample indications and one hundred
# thousand commands of every kind, memory, descriptors and threads compared between the end of
# the warm-up and the end), then a shorter soak with the daemon under valgrind memcheck. Prints
# the figures and exits non-zero when a check missed.
#   SOAK_INDICATIONS, SOAK_COMMANDS          size of the full soak (default 1000000, 100000)
#   SOAK_VG_INDICATIONS, SOAK_VG_COMMANDS    size of the valgrind soak (default 10000, 1000)
set -euo pipefail
here=$(cd "$(dirname "$0")/.." && pwd)
build=$(cd "${1:-build}" && pwd)
soak=$build/tools/soak/kestrel-soak
if [ ! -x "$soak" ]; then
  echo "soak: $soak is not built (make soak builds it)" >&2
  exit 2
fi
if [ "$(id -u)" -eq 0 ]; then
  netns=(unshare --net)
else
  netns=(unshare --user --map-root-user --net)
fi
registry=$here/tools/sim/sample_registry.txt
cpu=$(grep -m1 'model name' /proc/cpuinfo | cut -d: -f2 | sed 's/^ *//')
echo "soak: $(date -u '+%Y-%m-%d %H:%M UTC'), $(uname -sr) $(uname -m), $(nproc) cores, ${cpu:-unknown cpu}"

status=0
echo "== soak"
"${netns[@]}" "$soak" --registry "$registry" \
  --indications "${SOAK_INDICATIONS:-1000000}" --commands "${SOAK_COMMANDS:-100000}" || status=1

echo "== soak under valgrind memcheck"
# Everything is many times slower under valgrind: the 8 s wait is scaled to 1.6 s, not 0.4 s.
"${netns[@]}" "$soak" --registry "$registry" --valgrind \
  --suppressions "$here/tools/soak/valgrind.supp" --valgrind-log "$build/soak-valgrind.log" \
  --time-scale 0.2 \
  --indications "${SOAK_VG_INDICATIONS:-10000}" --commands "${SOAK_VG_COMMANDS:-1000}" || status=1

if [ $status -eq 0 ]; then echo "soak: passed"; else echo "soak: FAILED"; fi
exit $status
