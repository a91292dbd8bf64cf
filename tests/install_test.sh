#!/bin/bash
# Installs the build tree into a scratch DESTDIR with the command `make install` runs and checks
# the layout file by file, that a second install keeps an edited configuration, that the unit
# follows the prefix, and that each man page renders through groff without a warning.
# Usage: install_test.sh BUILD_DIR
set -euo pipefail
build=$1
tmp=$(mktemp -d)
# Each install rewrites the build's install manifest, which `make uninstall` reads: keep the
# one a real install left.
manifest=$build/install_manifest.txt
[ -f "$manifest" ] && cp -p "$manifest" "$tmp.manifest"
restore() {
  if [ -f "$tmp.manifest" ]; then mv "$tmp.manifest" "$manifest"; else rm -f "$manifest"; fi
  rm -rf "$tmp"
}
trap restore EXIT
fail() { echo "FAIL: $*" >&2; exit 1; }

DESTDIR=$tmp/root cmake --install "$build" --prefix /usr >"$tmp/log" || { cat "$tmp/log"; fail "install"; }

mapfile -t expected < <(grep -v '^#' "$(dirname "$0")/installed_files")
pages=(man5/tarvod-rules.5 man5/tarvod.plist.5 man8/tarvod.8 man8/tarvodctl.8)
if command -v scdoc >/dev/null; then
  for p in "${pages[@]}"; do expected+=("/usr/share/man/$p"); done
else
  echo "scdoc missing: man pages not checked"
fi
# Every file, and every directory with nothing in it, below the scratch root.
actual=$(cd "$tmp/root" && find . \( -type f -o -type l -o -type d -empty \) |
  sed -e 's/^\.//' | while read -r f; do [ -d "$tmp/root$f" ] && echo "$f/" || echo "$f"; done | sort)
want=$(printf '%s\n' "${expected[@]}" | sort)
diff <(echo "$want") <(echo "$actual") || fail "installed files differ (- expected, + installed)"

for b in usr/sbin/tarvod usr/bin/tarvodctl usr/libexec/tarvod/femail; do [ -x "$tmp/root/$b" ] || fail "$b not executable"; done
grep -qx 'ExecStart=/usr/sbin/tarvod' "$tmp/root/lib/systemd/system/tarvod.service" || fail "unit ExecStart"
# The binaries carry the version the package's changelog gives.
version=$(sed -n '1s/^tarvod (\([^)]*\)).*/\1/p' "$(dirname "$0")/../debian/changelog")
for b in usr/sbin/tarvod usr/bin/tarvodctl; do
  [ "$("$tmp/root/$b" --version)" = "$(basename "$b") $version" ] || fail "$b --version"
done
bash -n "$tmp/root/usr/share/bash-completion/completions/tarvodctl" || fail "completion syntax"

# The default configuration is a property list the daemon reads, comments and all: given an
# error log, with an empty rules directory it says so there and ends with status 0.
conf=$tmp/root/etc/tarvod.d/tarvod.plist
sed -e "s,<key>debugLevel</key>,<key>errorLogPath</key><string>$tmp/error.log</string>&," \
    -e "s,<string>/var/lib/tarvod</string>,<string>$tmp/state</string>," \
    -e "s,<string>/run/tarvod/,<string>$tmp/," -e "s,<string>journal</string>,<string>none</string>," \
    "$conf" >"$tmp/conf.plist"
"$tmp/root/usr/sbin/tarvod" -c "$tmp/conf.plist" -r "$tmp/root/etc/tarvod.d/rules" >"$tmp/out" 2>&1 ||
  { cat "$tmp/out"; fail "tarvod on the default configuration"; }
grep -q "No rules found" "$tmp/error.log" || fail "the default configuration was not read"

# A configuration the administrator changed survives a second install.
echo edited >"$conf"
DESTDIR=$tmp/root cmake --install "$build" --prefix /usr >"$tmp/log"
[ "$(cat "$conf")" = edited ] || fail "an existing configuration was overwritten"

# Another prefix moves the binaries and the unit's ExecStart with it.
DESTDIR=$tmp/local cmake --install "$build" --prefix /usr/local >"$tmp/log"
[ -x "$tmp/local/usr/local/sbin/tarvod" ] || fail "prefix /usr/local: no sbin/tarvod"
grep -qx 'ExecStart=/usr/local/sbin/tarvod' "$tmp/local/lib/systemd/system/tarvod.service" ||
  fail "prefix /usr/local: unit ExecStart"

if command -v groff >/dev/null && command -v scdoc >/dev/null; then
  for p in "${pages[@]}"; do
    warnings=$(groff -ww -man -Tutf8 "$tmp/root/usr/share/man/$p" 2>&1 >/dev/null)
    [ -z "$warnings" ] || fail "groff warns on $p: $warnings"
  done
else
  echo "groff or scdoc missing: rendering not checked"
fi
echo "install layout ok"
