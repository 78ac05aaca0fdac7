#!/usr/bin/env bash
# SPDX-License-Identifier: Apache-2.0
# Checks Android.bp the way a device tree will read it:
#   - bpfmt parses it, and it is formatted as bpfmt formats it;
#   - every file it names exists in the repository;
#   - libkestreld_core compiles the daemon sources of CMake's kestreld_core, plus the phone's
#     platform file, so that the two builds ship the same daemon.
#   android_bp_check.sh BPFMT REPOSITORY
set -euo pipefail

bpfmt=$1
root=$2
bp=Android.bp
cd "$root"
failed=0

if ! listed=$("$bpfmt" -l "$bp" 2>&1); then
  echo "$bp does not parse:" >&2
  echo "$listed" >&2
  exit 1
fi
if [ -n "$listed" ]; then
  echo "$bp is not formatted as bpfmt formats it (bpfmt -w $bp):" >&2
  "$bpfmt" -d "$bp" >&2
  failed=1
fi

for path in $(grep -o '"[^"]*\.\(cc\|rc\)"' "$bp" | tr -d '"' | sort -u); do
  if [ ! -f "$path" ]; then
    echo "$bp names $path, which does not exist" >&2
    failed=1
  fi
done

# The srcs of one module, one a line, sorted.
module_srcs() {
  awk -v name="\"$1\"" '
    $1 == "name:" && $2 == name "," { inside = 1 }
    inside && /srcs: \[/ { list = 1; next }
    list && /\]/ { exit }
    list { gsub(/[",[:space:]]/, ""); print }
  ' "$bp" | sort
}
# The sources of CMake's kestreld_core, one a line, sorted.
cmake_core_srcs() {
  awk '
    /^add_library\(kestreld_core / { inside = 1; next }
    inside && /\)/ { exit }
    inside { gsub(/[[:space:]]/, ""); if ($0 != "") print }
  ' CMakeLists.txt | sort
}

expected=$( (cmake_core_srcs; echo platform/device/platform_device.cc) | sort)
actual=$(module_srcs libkestreld_core)
if [ -z "$(cmake_core_srcs)" ]; then
  echo "no kestreld_core sources found in CMakeLists.txt" >&2
  failed=1
elif [ "$expected" != "$actual" ]; then
  echo "libkestreld_core in $bp and kestreld_core in CMakeLists.txt differ" \
       "(< CMake plus platform/device, > Android.bp):" >&2
  diff <(echo "$expected") <(echo "$actual") >&2 || true
  failed=1
fi

exit $failed
