#!/usr/bin/env bash
# Runs scripts/demo against the vantreld and vantrelctl of this build and
# checks that each sample plays its part in the story, and that the demo
# leaves neither its daemon nor its directory behind.
# Usage: demo_test.sh SOURCE_DIR BIN_DIR
set -euo pipefail
out=$(VANTREL_DEMO_BIN=$2 "$1/scripts/demo")

expect() {
  local count
  count=$(grep -cE -- "$2" <<<"$out" || true)
  if [ "$count" -ne "$1" ]; then
    printf 'expected %s line(s) matching: %s\nfound %s in:\n%s\n' "$1" "$2" "$count" "$out"
    exit 1
  fi
}
expect 1 '^Installed: +5 plug-ins$'
expect 2 '^2 plug-ins listed\.$'
expect 2 '^com\.example\.markdown +2\.0 +com\.karvo\.text-formatter +0 +Notes +/.*/Notes\.app/'
expect 1 '^com\.example\.notes\.share +1\.4 +com\.karvo\.share-services +0 +Notes '
expect 1 '^com\.example\.notes\.share +1\.4 +com\.karvo\.share-services +1 +Notes '
expect 1 '^com\.example\.journal\.share .*: not offered \(misconfigured\): mis-configured: Application Extensions may not use the "PrincipalClass" key$'
expect 1 '^com\.example\.markdown 1\.3 .*: not offered \(duplicate\): .*/Notes\.app/PlugIns/Markdown\.appex \(2\.0\), by higher-version$'
expect 1 '^com\.example\.notes\.widget .*: not offered \(dedicated\): '
expect 1 '^com\.example\.notes\.share .*: election 0 -> 1$'
expect 1 '^  kill %1; rm -rf /tmp/vt$'

line=$(grep -E '^vantreld runs \(pid [0-9]+\) in ' <<<"$out")
pid=$(sed -E 's/^vantreld runs \(pid ([0-9]+)\) in ([^ ]+) .*/\1/' <<<"$line")
tree=$(sed -E 's/^vantreld runs \(pid ([0-9]+)\) in ([^ ]+) .*/\2/' <<<"$line")
if kill -0 "$pid" 2>/dev/null; then
  echo "the demo's vantreld (pid $pid) still runs"
  exit 1
fi
if [ -e "$tree" ]; then
  echo "the demo left $tree behind"
  exit 1
fi
