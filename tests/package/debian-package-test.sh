#!/usr/bin/env bash
# Builds the Debian packages from the source tree, extracts them into a temporary root (dpkg -x)
# and runs the installed programs from there on a private platform root: spawnd and a signed axd
# start, a match finds a registered plug-in and a ready of it succeeds, a C host builds against the
# installed header, pkg-config file and library and matches through it; the manual pages render
# without warnings and the bash completions load.
#   tests/package/debian-package-test.sh [SOURCE_DIR]
set -euo pipefail
src=$(cd "${1:-$(dirname "$0")/../..}" && pwd)
work=$(mktemp -d /tmp/annexa-package.XXXXXX)
pids=()
cleanup() {
    for pid in "${pids[@]}"; do kill "$pid" 2>/dev/null && wait "$pid" 2>/dev/null; done
    rm -rf "$work"
}
trap cleanup EXIT
fail() { echo "debian-package-test: $*" >&2; exit 1; }

echo "== building the Debian packages (in $work)"
mkdir -p "$work/src"
# The sources as the repository has them, without build trees.
(cd "$src" && git ls-files -z --cached --others --exclude-standard | xargs -0 tar -cf - ) | tar -xf - -C "$work/src"
(cd "$work/src" && DEB_BUILD_OPTIONS="nocheck parallel=$(nproc)" dpkg-buildpackage -b -us -uc >"$work/build.log" 2>&1) ||
    { tail -n 40 "$work/build.log"; fail "dpkg-buildpackage failed"; }
for package in annexa libannexa1 libannexa-dev; do
    deb=$(ls "$work"/${package}_*.deb 2>/dev/null | head -n 1)
    [ -n "$deb" ] || fail "no package $package was built"
    dpkg -x "$deb" "$work/root"
done
usr=$work/root/usr
libdir=$(dirname "$(find "$usr/lib" -name 'libannexa.so.1' | head -n 1)")
[ -n "$libdir" ] || fail "libannexa.so.1 is not in the packages"
for program in axd spawnd axctl vantry axsign pcx; do [ -x "$usr/bin/$program" ] || fail "no $program"; done
for unit in axd.socket axd.service spawnd.socket spawnd.service; do
    [ -f "$usr/lib/systemd/user/$unit" ] || fail "no unit $unit"
done
readelf -d "$libdir/libannexa.so.1" | grep -q 'SONAME.*libannexa.so.1' || fail "libannexa has no soname libannexa.so.1"

echo "== the manual pages render, the completions load"
for page in "$usr"/share/man/man*/*; do
    warnings=$(MANWIDTH=80 man --warnings -l "$page" 2>&1 >/dev/null)
    [ -z "$warnings" ] || fail "$page: $warnings"
done
for tool in axctl vantry axsign pcx spawnd; do
    bash -c "source /usr/share/bash-completion/bash_completion && source '$usr/share/bash-completion/completions/$tool' && complete -p $tool" \
        >/dev/null || fail "the completion of $tool does not load"
done

echo "== the installed programs on a private platform root"
export CORVANE_ROOT=$work/platform CORVANE_LOG_SINK=stderr
mkdir -p "$CORVANE_ROOT"
"$usr/bin/axsign" keygen --out "$work/key" >/dev/null
"$usr/bin/axsign" trust "$work/key.pub" >/dev/null
cat >"$work/axd-entitlements.plist" <<'PLIST'
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict><key>com.corvane.private.rpx.domain-extension.proxy</key><true/></dict></plist>
PLIST
cp "$usr/bin/axd" "$work/axd"
"$usr/bin/axsign" sign --key "$work/key" --entitlements "$work/axd-entitlements.plist" "$work/axd" >/dev/null
"$usr/bin/spawnd" 2>"$work/spawnd.log" &
pids+=($!)
"$work/axd" 2>"$work/axd.log" &
pids+=($!)
rpx=$CORVANE_ROOT/run/user/$(id -u)/rpx
for _ in $(seq 100); do [ -S "$rpx/com.corvane.annexa.axd" ] && [ -S "$rpx/com.corvane.spawnd" ] && break; sleep 0.05; done

app=$work/Apps/Packaged.app
mkdir -p "$app/PlugIns/One.appex"
printf '%s\n' '<?xml version="1.0" encoding="UTF-8"?>' \
    '<plist version="1.0"><dict><key>KFBundleIdentifier</key><string>com.example.packaged</string></dict></plist>' \
    >"$app/Info.plist"
printf '%s\n' '<?xml version="1.0" encoding="UTF-8"?>' '<plist version="1.0"><dict>' \
    '<key>KFBundleIdentifier</key><string>com.example.packaged.one</string>' \
    '<key>KFBundleExecutable</key><string>One</string><key>KFBundleVersion</key><string>1</string>' \
    '<key>KSExtension</key><dict><key>KSExtensionPointIdentifier</key><string>com.example.point</string>' \
    '<key>KSExtensionAttributes</key><dict/></dict></dict></plist>' >"$app/PlugIns/One.appex/Info.plist"
cp /bin/true "$app/PlugIns/One.appex/One"
"$usr/bin/axctl" add "$app"
uuid=$("$usr/bin/axctl" match -r KSExtensionIdentifier=com.example.packaged.one | awk '{print $1}')
[ -n "$uuid" ] || fail "match did not find the registered plug-in"
"$usr/bin/axctl" ready "$uuid" || { cat "$work/axd.log"; fail "ready failed"; }

echo "== a C host built against the installed library"
cat >"$work/host.c" <<'C'
#include <annexa.h>
#include <stdio.h>
#include <string.h>
int main(void) {
    annexa_client* client = annexa_client_create(NULL);
    char* matches = NULL;
    char* error = NULL;
    int64_t code = annexa_match(client, "{\"KSExtensionIdentifier\": \"com.example.packaged.one\"}", 0, &matches, &error);
    int found = code == 0 && strstr(matches, "com.example.packaged.one") != NULL;
    if (!found) fprintf(stderr, "match: %lld %s\n", (long long)code, error ? error : matches);
    annexa_free(matches);
    annexa_free(error);
    annexa_client_destroy(client);
    return found ? 0 : 1;
}
C
# The .pc file finds its prefix from its own place, so the extracted tree works as installed.
flags=$(PKG_CONFIG_LIBDIR=$libdir/pkgconfig pkg-config --cflags --libs annexa)
cc "$work/host.c" $flags -o "$work/host" || fail "a host does not build against the installed files"
LD_LIBRARY_PATH=$libdir "$work/host" || fail "the C host's match failed"
echo "debian-package-test: the packages build, install and work"
