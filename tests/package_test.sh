#!/bin/bash
# Checks the Debian package `make deb` left in DEB_DIR: the files it installs, the
# configuration marked as conffiles, and maintainer scripts that enable and start nothing.
# Usage: package_test.sh DEB_DIR
set -euo pipefail
dir=$1
fail() { echo "FAIL: $*" >&2; exit 1; }
debs=("$dir"/tarvod_*.deb)
[ -f "${debs[0]}" ] || fail "no package in $dir"
deb=${debs[0]}

mapfile -t expected < <(grep -v '^#' "$(dirname "$0")/installed_files")
expected+=(/usr/share/doc/tarvod/README.md.gz /usr/share/doc/tarvod/changelog.gz
  /usr/share/doc/tarvod/copyright)
for p in man5/tarvod-rules.5 man5/tarvod.plist.5 man8/tarvod.8 man8/tarvodctl.8; do
  expected+=("/usr/share/man/$p.gz")
done
# Files, and directories with nothing below them, as dpkg -c lists them.
listing=$(dpkg-deb -c "$deb" | awk '{print $6}' | sed -e 's,^\./,/,')
actual=$(echo "$listing" | while read -r f; do
  case $f in
    */) grep -q "^$f." <<<"$listing" || echo "$f" ;;
    *) echo "$f" ;;
  esac
done | grep -v '^/usr/share/doc/tarvod/examples/' | sort)
want=$(printf '%s\n' "${expected[@]}" | sort)
diff <(echo "$want") <(echo "$actual") || fail "packaged files differ (- expected, + packaged)"
grep -q '^/usr/share/doc/tarvod/examples/rulesets/.*\.plist$' <<<"$listing" ||
  fail "no example rule sets"

control=$(mktemp -d)
trap 'rm -rf "$control"' EXIT
dpkg-deb -e "$deb" "$control"
for f in /etc/tarvod.d/tarvod.plist /etc/logrotate.d/tarvod; do
  grep -qx "$f" "$control/conffiles" || fail "$f is not a conffile"
done
# debhelper re-enables on upgrade only a service the administrator had enabled (was-enabled);
# nothing else may enable or start it.
postinst=$(cat "$control/postinst" 2>/dev/null || true)
if echo "$postinst" | grep -q 'deb-systemd-invoke' ||
  { echo "$postinst" | grep -q 'deb-systemd-helper enable' &&
    ! echo "$postinst" | grep -q 'deb-systemd-helper --quiet was-enabled'; }; then
  fail "the package enables or starts the service"
fi
echo "package ok: $(basename "$deb")"
