#!/bin/sh
# check_probes.sh BINARY
# Exits 0 when BINARY carries every probe of the provider "vantreld" in its
# systemtap SDT notes; otherwise prints one "missing probe: NAME" line per
# absent probe and exits 1. Exits 2 when BINARY cannot be read.
set -u
if [ $# -ne 1 ]; then
  echo "usage: check_probes.sh BINARY" >&2
  exit 2
fi
notes=$(readelf -n "$1" 2>/dev/null) || { echo "cannot read notes of $1" >&2; exit 2; }

# The notes list "Provider: P" then "Name: N" per probe; keep this provider's names.
names=$(printf '%s\n' "$notes" | awk '
  $1 == "Provider:" { provider = $2 }
  $1 == "Name:" && provider == "vantreld" { print $2 }')

status=0
for probe in client-new client-done request request-input request-output \
             db-load discover-raw plugin-add plugin-ready plugin-remove; do
  # In the notes a dash in a probe name is stored as a double underscore.
  stored=$(printf '%s' "$probe" | sed 's/-/__/g')
  if ! printf '%s\n' "$names" | grep -qx "$stored"; then
    echo "missing probe: $probe"
    status=1
  fi
done
exit $status
