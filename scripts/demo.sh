#!/usr/bin/env bash
# SPDX-License-Identifier: Apache-2.0
# make demo: a factory session against the simulated sensor processor. Starts kestrel-sim and
# kestreld in a private network namespace, drives the daemon with kestrelctl as the kernel's
# factory driver would, and shows what came back.
set -euo pipefail
build=${1:-build}
here=$(cd "$(dirname "$0")/.." && pwd)
build=$(cd "$build" && pwd)
if [ "$(id -u)" -eq 0 ]; then
  exec unshare --net "$here/scripts/demo_session.sh" "$build"
else
  exec unshare --user --map-root-user --net "$here/scripts/demo_session.sh" "$build"
fi
