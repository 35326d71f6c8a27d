#!/usr/bin/env bash
# Installs the build into a temporary prefix, builds examples/host against
# the installed client library with CMake's find_package and with
# pkg-config, and runs both against the installed vantreld: each finds the
# sample plug-in, readies it and starts it.
#
#   example_host.sh BUILD_DIR SOURCE_DIR [EXTRA_CXXFLAGS]
set -euo pipefail
build=$1 source=$2 extra=${3:-}
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

prefix=$work/prefix
cmake --install "$build" --prefix "$prefix" >/dev/null
pc=$(find "$prefix" -name vantrel-client.pc)
libdir=${pc%/pkgconfig/vantrel-client.pc}

# Both ways a host developer builds.
cmake -S "$source/examples/host" -B "$work/cmake-build" -G Ninja \
  -DCMAKE_PREFIX_PATH="$prefix" -DCMAKE_CXX_FLAGS="$extra" >/dev/null
cmake --build "$work/cmake-build" >/dev/null
mkdir -p "$work/make-build"
PKG_CONFIG_PATH=$libdir/pkgconfig make -s -C "$source/examples/host" \
  OUT="$work/make-build" CXXFLAGS="-O1 -g $extra" LDFLAGS="$extra"

# A tree with one application carrying one plug-in of "com.example.point";
# the plug-in's executable is a script that says it ran.
app=$work/apps/Example.app
plugin=$app/PlugIns/Greeter.appex
mkdir -p "$plugin" "$work/run" "$work/state" "$work/System"
cat > "$app/Info.plist" <<'PLIST'
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict><key>KBBundleIdentifier</key><string>com.example.app</string></dict></plist>
PLIST
cat > "$plugin/Info.plist" <<'PLIST'
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>KBBundleIdentifier</key><string>com.example.greeter</string>
  <key>KBBundleVersion</key><string>1</string>
  <key>KBBundleExecutable</key><string>greeter</string>
  <key>QXExtension</key><dict>
    <key>QXExtensionPointIdentifier</key><string>com.example.point</string>
    <key>QXExtensionProtocol</key><string>P</string>
    <key>QXExtensionAttributes</key><dict/>
  </dict>
</dict></plist>
PLIST
printf '#!/bin/sh\necho greeter ran\n' > "$plugin/greeter"
chmod 755 "$plugin/greeter"

export VANTREL_RUNTIME_DIR=$work/run VANTREL_STATE_DIR=$work/state \
  VANTREL_APP_DIRS=$work/apps VANTREL_PLUGIN_DIRS=$work/System/Library/PlugIns \
  VANTREL_SDK_DIRS=$work/sdks VANTREL_SYSTEM_DIR=$work/System \
  VANTREL_PREFERENCES_DIR=$work/prefs XDG_STATE_HOME=$work/xdg
socket=$work/run/vantreld.socket
VANTREL_LOG=stderr "$prefix/sbin/vantreld" -S "$socket" 2>"$work/vantreld.log" &
daemon=$!
for _ in $(seq 100); do
  "$prefix/bin/vantrelctl" -S "$socket" --timeout 1 status >/dev/null 2>&1 && break
  sleep 0.1
done

status=0
for host in "$work/cmake-build/vantrel-example-host" "$work/make-build/vantrel-example-host"; do
  out=$(LD_LIBRARY_PATH=$libdir "$host" com.example.point "$socket" 2>&1) || status=1
  echo "$host: $out"
  case $out in *"greeter ran"*"exited with status 0"*) ;; *) status=1 ;; esac
done
# The hosts run on the installed library, not on anything in the build tree.
# Not piped into grep -q: under pipefail, ldd killed by the early exit's
# SIGPIPE would fail the check now and then.
libraries=$(LD_LIBRARY_PATH=$libdir ldd "$work/make-build/vantrel-example-host")
grep -q "$libdir/libvantrel-client.so" <<<"$libraries" || status=1
[ $status -eq 0 ] || cat "$work/vantreld.log" >&2
exit $status
