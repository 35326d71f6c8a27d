#!/usr/bin/env bash
# Packages the build as Debian packages, checks what they hold, unpacks them
# into a scratch root and runs the unpacked vantreld and vantrelctl there.
#
#   package.sh BUILD_DIR
set -euo pipefail
build=$1
work=$(mktemp -d)
daemon=""
cleanup() {
  if [ -n "$daemon" ]; then
    kill "$daemon" 2>/dev/null || true
    wait "$daemon" 2>/dev/null || true
  fi
  rm -rf "$work"
}
trap cleanup EXIT

cpack -G DEB --config "$build/CPackConfig.cmake" -B "$work/out" >/dev/null
runtime=$(ls "$work"/out/vantrel_*.deb)
dev=$(ls "$work"/out/vantrel-dev_*.deb)
case $(basename "$runtime") in vantrel_*_*.deb) ;; *) echo "odd name: $runtime" >&2; exit 1 ;; esac

status=0
expect() {  # expect DEB PATTERN...: every pattern names a file in the package
  local deb=$1 listing
  shift
  listing=$(dpkg-deb -c "$deb" | awk '{print $6}')
  for pattern in "$@"; do
    if ! grep -Eq "^\./usr/$pattern\$" <<<"$listing"; then
      echo "$(basename "$deb") lacks usr/$pattern" >&2
      status=1
    fi
  done
}
expect "$runtime" sbin/vantreld bin/vantrelctl bin/vantrel-inspect \
  'lib/(.*/)?libvantrel-client\.so\.[0-9]+\.[0-9]+\.[0-9]+' \
  lib/systemd/system/vantreld.service lib/systemd/system/vantreld.socket \
  lib/systemd/user/vantreld.service lib/systemd/user/vantreld.socket \
  share/bash-completion/completions/vantrelctl share/man/man1/vantrelctl.1 \
  share/man/man1/vantrel-inspect.1 share/man/man8/vantreld.8 \
  share/vantrel/sdks/README
expect "$dev" include/vantrel/client/VTDaemonClient.h include/vantrel/lmo/Protocol.h \
  'lib/(.*/)?pkgconfig/vantrel-client\.pc' 'lib/(.*/)?cmake/vantrel-client/vantrel-clientConfig\.cmake'
# Headers belong to -dev alone.
if dpkg-deb -c "$runtime" | grep -q '/include/'; then echo "headers in the runtime package" >&2; status=1; fi
dpkg-deb -f "$dev" Depends | grep -q 'vantrel (=' || { echo "vantrel-dev does not depend on vantrel" >&2; status=1; }

root=$work/root
dpkg -x "$runtime" "$root"
grep -q "^ExecStart=/usr/sbin/vantreld" "$root/usr/lib/systemd/system/vantreld.service" || status=1

mkdir -p "$work/run" "$work/apps"
socket=$work/run/vantreld.socket
VANTREL_LOG=stderr VANTREL_RUNTIME_DIR=$work/run VANTREL_STATE_DIR=$work/state \
  VANTREL_APP_DIRS=$work/apps VANTREL_SYSTEM_DIR=$work/System XDG_STATE_HOME=$work/xdg \
  VANTREL_PREFERENCES_DIR=$work/prefs "$root/usr/sbin/vantreld" -S "$socket" 2>"$work/log" &
daemon=$!
answered=1
for _ in $(seq 100); do
  if "$root/usr/bin/vantrelctl" -S "$socket" --timeout 1 status >"$work/status" 2>&1; then
    answered=0
    break
  fi
  sleep 0.1
done
cat "$work/status"
[ $answered -eq 0 ] || { cat "$work/log" >&2; status=1; }
exit $status
