#!/usr/bin/env bash
# Builds the Debian packages from the source tree, installs them on this machine (CI's machines are
# throwaway, and the test runs as root) and uses them as ordinary users would:
#   - lintian finds no error and no warning in them;
#   - the installation makes the machine's key, signs the programs and creates the system registry;
#   - a package that ships an application into /usr/lib/corvane/Applications needs no script of its
#     own: the trigger registers it, and removing the package unregisters it and ends its instance;
#   - two users, each with the two daemons started as a user manager would (socket activation with
#     the units' environment), register applications of their own and see the system's, not each
#     other's; a C host and a C plug-in build against the installed library;
#   - the Python package's tests pass against the installed tree, and docs/first-plugin.md, run
#     literally as alice, goes from nothing to a C and a Python plug-in answering their hosts;
#   - purging leaves no file of ours (a listing of /etc, /usr and /var/lib before and after).
#   tests/package/debian-package-test.sh [SOURCE_DIR]
# AX_PACKAGE_KEEP=DIR keeps the built packages there; AX_PACKAGE_PREBUILT=DIR uses those instead of
# building.
set -euo pipefail
src=$(cd "${1:-$(dirname "$0")/../..}" && pwd)
work=$(mktemp -d /tmp/annexa-package.XXXXXX)
chmod 0755 "$work"
users=(axpkg-alice axpkg-bob)
ours=(annexa-test-greeter annexa-extensions python3-annexa libannexa-dev libannexa1 annexa)
pids=()
guide_key=/home/axpkg-alice/.config/corvane/developer.key.pub
export DEBIAN_FRONTEND=noninteractive
# The test's users go with everything they had, so that a second run starts as fresh as the first.
remove_users() {
    for user in "${users[@]}"; do
        id "$user" >/dev/null 2>&1 || continue
        pkill -KILL -u "$user" 2>/dev/null || true
        rm -rf "/run/user/$(id -u "$user")"
        userdel --remove "$user" 2>/dev/null || true
    done
}
cleanup() {
    for pid in "${pids[@]}"; do kill "$pid" 2>/dev/null || true; done
    remove_users
    for key in "$work/developer.key.pub" "$guide_key"; do
        [ -f "$key" ] && axsign untrust "$key" >/dev/null 2>&1 || true
    done
    dpkg --purge "${ours[@]}" >/dev/null 2>&1 || true
    rm -rf "$work"
}
trap cleanup EXIT
fail() { echo "debian-package-test: $*" >&2; exit 1; }
# The files of the system that a package of ours could leave behind.
listing() {
    find /etc /usr /var/lib -xdev \( -path /var/lib/dpkg -o -path /var/lib/apt -o -path /var/lib/ucf \) -prune -o -print 2>/dev/null |
        sort
}

if [ -n "${AX_PACKAGE_PREBUILT:-}" ]; then
    # A developer's shortcut: packages built earlier, in that directory.
    cp "$AX_PACKAGE_PREBUILT"/*.deb "$work"/
else
    echo "== building the Debian packages (in $work)"
    mkdir -p "$work/src"
    # The sources as the repository has them, without build trees.
    (cd "$src" && git ls-files -z --cached --others --exclude-standard | xargs -0 tar -cf - ) | tar -xf - -C "$work/src"
    (cd "$work/src" && DEB_BUILD_OPTIONS="nocheck parallel=$(nproc)" dpkg-buildpackage -b -us -uc >"$work/build.log" 2>&1) ||
        { tail -n 40 "$work/build.log"; fail "dpkg-buildpackage failed"; }
    [ -z "${AX_PACKAGE_KEEP:-}" ] || cp "$work"/*.deb "$AX_PACKAGE_KEEP"/
fi
debs=()
for package in annexa libannexa1 libannexa-dev python3-annexa annexa-extensions; do
    deb=$(ls "$work"/${package}_*.deb 2>/dev/null | head -n 1)
    [ -n "$deb" ] || fail "no package $package was built"
    debs+=("$deb")
done
lintian --fail-on error,warning --tag-display-limit 0 "${debs[@]}" >"$work/lintian.log" 2>&1 ||
    { grep -v 'root privileges' "$work/lintian.log"; fail "lintian finds errors or warnings"; }

echo "== users, and what the machine holds before"
remove_users
for user in "${users[@]}"; do useradd --create-home --shell /bin/bash "$user"; done
# What the packages depend on comes in first (and stays), so that the listings differ only by ours.
dpkg --purge "${ours[@]}" >/dev/null 2>&1 || true
apt-get install -y -qq "${debs[@]}" >"$work/apt.log" 2>&1 || { cat "$work/apt.log"; fail "the packages do not install"; }
dpkg --purge "${ours[@]}" >/dev/null
listing >"$work/before"

echo "== installing: the machine's key, the programs' signatures, the system registry"
dpkg -i "${debs[@]}" >"$work/dpkg.log" 2>&1 || { cat "$work/dpkg.log"; fail "dpkg -i failed"; }
[ "$(stat -c '%a %U' /etc/corvane/keys/machine.key)" = "600 root" ] || fail "the machine key is not root's alone"
for program in axd axctl pcx; do
    axsign verify "/usr/bin/$program" >/dev/null || fail "/usr/bin/$program is not signed"
done
axsign show /usr/bin/axd | grep -q 'com.corvane.private.rpx.domain-extension.proxy' || fail "axd lacks its entitlement"
axsign show /usr/bin/annexa-extensions | grep -q 'com.corvane.private.annexa.manager' ||
    fail "the Extensions panel lacks the manager entitlement"
appstream-util validate /usr/share/metainfo/com.corvane.annexa.Extensions.metainfo.xml >/dev/null ||
    fail "the panel's AppStream metadata does not validate"
desktop-file-validate /usr/share/applications/com.corvane.annexa.Extensions.desktop || fail "the panel's desktop entry does not validate"
[ -f /var/lib/corvane/vantry/registry.db ] || fail "no system registry"
[ -d /usr/lib/corvane/Applications ] || fail "no system applications directory"
libdir=$(dirname "$(find /usr/lib -name 'libannexa.so.1.0.0' | head -n 1)")
[ -n "$libdir" ] || fail "libannexa.so.1.0.0 is not installed"
readelf -d "$libdir/libannexa.so.1.0.0" | grep -q 'SONAME.*libannexa.so.1' || fail "libannexa has no soname libannexa.so.1"
[ "$(pkg-config --variable=prefix annexa)" = /usr ] || fail "annexa.pc does not name /usr"
[ -f /usr/share/doc/annexa/README.md.gz ] || [ -f /usr/share/doc/annexa/README.md ] || fail "README is not installed"

echo "== the manual pages render, the completions load"
for page in $(dpkg -L annexa annexa-extensions | grep '/man/man[0-9]/'); do
    [ -f "$page" ] || continue
    warnings=$(MANWIDTH=80 man --warnings -l "$page" 2>&1 >/dev/null)
    [ -z "$warnings" ] || fail "$page: $warnings"
done
for tool in axctl vantry axsign pcx spawnd; do
    bash -c "source /usr/share/bash-completion/bash_completion && source /usr/share/bash-completion/completions/$tool && complete -p $tool" \
        >/dev/null || fail "the completion of $tool does not load"
done

echo "== a package that ships a signed application, with a plug-in built against the installed library"
stage=$work/greeter-package
bundle=$stage/usr/lib/corvane/Applications/Greeter.app
mkdir -p "$stage/DEBIAN" "$bundle/PlugIns/Hello.appex"
cat >"$stage/DEBIAN/control" <<CONTROL
Package: annexa-test-greeter
Version: 1.0
Architecture: $(dpkg --print-architecture)
Maintainer: Annexa developers <annexa@corvane.invalid>
Depends: annexa, libannexa1
Description: an application with one plug-in, for the package test
CONTROL
printf '%s\n' '<?xml version="1.0" encoding="UTF-8"?>' '<plist version="1.0"><dict>' \
    '<key>KFBundleIdentifier</key><string>com.example.greeter</string>' \
    '<key>KFBundleDisplayName</key><string>Greeter</string></dict></plist>' >"$bundle/Info.plist"
printf '%s\n' '<?xml version="1.0" encoding="UTF-8"?>' '<plist version="1.0"><dict>' \
    '<key>KFBundleIdentifier</key><string>com.example.greeter.hello</string>' \
    '<key>KFBundleExecutable</key><string>Hello</string><key>KFBundleVersion</key><string>1</string>' \
    '<key>KFBundlePackageType</key><string>RPX!</string>' \
    '<key>KSExtension</key><dict><key>KSExtensionPointIdentifier</key><string>com.example.greeting</string>' \
    '<key>KSExtensionAttributes</key><dict/></dict></dict></plist>' >"$bundle/PlugIns/Hello.appex/Info.plist"
cat >"$work/hello.c" <<'C'
#include <annexa.h>
#include <stdlib.h>
#include <string.h>
static char* greet(const char* message, void* context) {
    (void)message;
    (void)context;
    return strdup("{\"greeting\": \"hello from the system\"}");
}
int main(void) { return annexa_plugin_run(greet, NULL) == 0 ? 0 : 1; }
C
cc "$work/hello.c" $(pkg-config --cflags --libs annexa) -o "$bundle/PlugIns/Hello.appex/Hello" ||
    fail "a plug-in does not build against the installed files"
axsign keygen --out "$work/developer.key" >/dev/null
axsign trust "$work/developer.key.pub" >/dev/null
axsign sign --key "$work/developer.key" "$bundle/PlugIns/Hello.appex" >/dev/null
dpkg-deb --build --root-owner-group "$stage" "$work/greeter.deb" >/dev/null
dpkg -i "$work/greeter.deb" >"$work/dpkg-greeter.log" 2>&1 || { cat "$work/dpkg-greeter.log"; fail "the test package does not install"; }
vantry --system list | grep -q 'com.example.greeter.hello' || fail "the trigger did not register the packaged application"

# As a user, with only what a user manager gives a service: HOME, XDG_RUNTIME_DIR, PATH, LANG.
as() {
    local user=$1
    shift
    local uid
    uid=$(id -u "$user")
    runuser -u "$user" -- env -i HOME="$(getent passwd "$user" | cut -d: -f6)" XDG_RUNTIME_DIR="/run/user/$uid" \
        PATH=/usr/bin:/bin LANG=C.UTF-8 "$@"
}
start_daemons() {
    local user=$1 uid rpx
    uid=$(id -u "$user")
    rpx=/run/user/$uid/rpx
    # As logind makes it at login: new, the user's, 0700.
    rm -rf "/run/user/$uid"
    install -d -o "$user" -g "$user" -m 0700 "/run/user/$uid"
    as "$user" mkdir -p -m 0700 "$rpx"
    local environment=(-E HOME -E XDG_RUNTIME_DIR -E PATH -E LANG)
    as "$user" systemd-socket-activate "${environment[@]}" -l "$rpx/com.corvane.annexa.axd" \
        --fdname=com.corvane.annexa.axd /usr/bin/axd 2>>"$work/$user-axd.log" &
    pids+=($!)
    as "$user" systemd-socket-activate "${environment[@]}" -l "$rpx/com.corvane.spawnd" -l "$rpx/com.corvane.vigild" \
        -l "$rpx/com.corvane.sandbox" -l "$rpx/com.corvane.pcx" /usr/bin/spawnd 2>>"$work/$user-spawnd.log" &
    pids+=($!)
    for _ in $(seq 100); do [ -S "$rpx/com.corvane.annexa.axd" ] && [ -S "$rpx/com.corvane.pcx" ] && return; sleep 0.05; done
    fail "the daemons of $user do not listen"
}
logs() { tail -n 20 "$work"/*-axd.log "$work"/*-spawnd.log 2>/dev/null || true; }
uuid_of() {
    as "$1" axctl match -r "KSExtensionIdentifier=$2" | awk '{print $1}'
}

echo "== alice registers an application of her own, and uses the system's"
start_daemons axpkg-alice
home=$(getent passwd axpkg-alice | cut -d: -f6)
as axpkg-alice mkdir -p "$home/.local/share/corvane/Applications"
as axpkg-alice cp -r "$bundle" "$home/.local/share/corvane/Applications/Mine.app"
as axpkg-alice sed -i 's/com.example.greeter/com.example.alice/' \
    "$home/.local/share/corvane/Applications/Mine.app/Info.plist" \
    "$home/.local/share/corvane/Applications/Mine.app/PlugIns/Hello.appex/Info.plist"
as axpkg-alice axctl add "$home/.local/share/corvane/Applications/Mine.app" || { logs; fail "alice cannot add her application"; }
[ -n "$(uuid_of axpkg-alice com.example.alice.hello)" ] || fail "alice does not find her plug-in"
[ -f "$home/.local/state/corvane/vantry/registry.db" ] || fail "alice's registry is not in her state directory"
system=$(uuid_of axpkg-alice com.example.greeter.hello)
[ -n "$system" ] || { logs; fail "alice does not see the system's plug-in"; }
as axpkg-alice axctl ready "$system" || { logs; fail "alice cannot get the system's plug-in ready"; }
# An instance that keeps running until the package is removed.
mkfifo "$work/keep"
chmod 0666 "$work/keep"
as axpkg-alice axctl run --keep "$system" '{"say": "hi"}' <"$work/keep" >"$work/run.out" 2>"$work/run.err" &
running=$!
exec 9>"$work/keep"
for _ in $(seq 100); do grep -q 'hello from the system' "$work/run.out" && break; sleep 0.05; done
grep -q 'hello from the system' "$work/run.out" || { cat "$work/run.err"; logs; fail "the plug-in did not reply"; }
pgrep -u axpkg-alice -f 'Greeter.app/PlugIns/Hello.appex/Hello' >/dev/null || fail "no running instance"

echo "== what an ordinary user may not do"
set +e
as axpkg-alice axsign trust "$work/developer.key.pub" >/dev/null 2>"$work/trust.err"
status=$?
as axpkg-alice vantry --system register "$home/.local/share/corvane/Applications/Mine.app" >/dev/null 2>"$work/system.err"
system_status=$?
as axpkg-alice axctl remove /usr/lib/corvane/Applications/Greeter.app >/dev/null 2>"$work/remove.err"
remove_status=$?
# A copy of axctl has no signature, so no manager entitlement: axd itself refuses the change.
as axpkg-alice cp /usr/bin/axctl "$home/axctl"
as axpkg-alice "$home/axctl" add /usr/lib/corvane/Applications/Greeter.app >/dev/null 2>"$work/add.err"
add_status=$?
set -e
[ "$add_status" = 77 ] && grep -q 'only root or a manager may change the system registry' "$work/add.err" ||
    fail "an unsigned axctl adding a system application: $add_status $(cat "$work/add.err")"
grep -q 'only its owner writes' "$work/remove.err" || fail "axctl remove of a system application: $remove_status $(cat "$work/remove.err")"
[ "$status" = 77 ] && grep -q 'run it as root' "$work/trust.err" || fail "axsign trust as a user: $status $(cat "$work/trust.err")"
[ "$system_status" = 65 ] && grep -q 'only its owner writes' "$work/system.err" ||
    fail "vantry --system as a user: $system_status $(cat "$work/system.err")"

echo "== bob sees the system's application, not alice's"
start_daemons axpkg-bob
[ -n "$(uuid_of axpkg-bob com.example.greeter.hello)" ] || { logs; fail "bob does not see the system's plug-in"; }
[ -z "$(uuid_of axpkg-bob com.example.alice.hello)" ] || fail "bob sees alice's plug-in"

echo "== removing the package unregisters its application and ends its instance"
dpkg -r annexa-test-greeter >"$work/dpkg-r.log" 2>&1 || { cat "$work/dpkg-r.log"; fail "dpkg -r failed"; }
for _ in $(seq 100); do pgrep -u axpkg-alice -f 'Greeter.app/PlugIns/Hello.appex/Hello' >/dev/null || break; sleep 0.05; done
pgrep -u axpkg-alice -f 'Greeter.app/PlugIns/Hello.appex/Hello' >/dev/null && { logs; fail "the instance outlived its package"; }
[ -z "$(uuid_of axpkg-alice com.example.greeter.hello)" ] || fail "the removed plug-in is still found"
exec 9>&-
wait "$running" 2>/dev/null || true

echo "== a C host built against the installed library"
cat >"$work/host.c" <<'C'
#include <annexa.h>
#include <stdio.h>
#include <string.h>
int main(void) {
    annexa_client* client = annexa_client_create(NULL);
    char* matches = NULL;
    char* error = NULL;
    int64_t code = annexa_match(client, "{\"KSExtensionIdentifier\": \"com.example.alice.hello\"}", 0, &matches, &error);
    int found = code == 0 && strstr(matches, "com.example.alice.hello") != NULL;
    if (!found) fprintf(stderr, "match: %lld %s\n", (long long)code, error ? error : matches);
    annexa_free(matches);
    annexa_free(error);
    annexa_client_destroy(client);
    return found ? 0 : 1;
}
C
cc "$work/host.c" $(pkg-config --cflags --libs annexa) -o "$work/host" || fail "a host does not build against the installed files"
as axpkg-alice "$work/host" || fail "the C host's match failed"

echo "== the Python package's tests, against the installed package and library"
[ "$(/usr/bin/python3 -c 'import annexa; print(annexa.__file__)')" = /usr/lib/python3/dist-packages/annexa/__init__.py ] ||
    fail "python3 does not import the installed annexa"
(cd "$src/python/tests" && env -u ANNEXA_BIN -u ANNEXA_LIBRARY PYTHONDONTWRITEBYTECODE=1 \
    /usr/bin/python3 -m pytest -q -p no:cacheprovider .) || fail "the Python package's tests failed"

echo "== docs/first-plugin.md, followed literally by alice"
/usr/bin/python3 "$src/tests/package/run-guide.py" --user axpkg-alice "$src/docs/first-plugin.md" >"$work/guide.log" 2>&1 ||
    { cat "$work/guide.log"; logs; fail "the guide does not work as written"; }
tail -n 1 "$work/guide.log"

echo "== purging leaves nothing of ours"
for pid in "${pids[@]}"; do kill "$pid" 2>/dev/null || true; done
for user in "${users[@]}"; do pkill -u "$user" 2>/dev/null || true; done
pids=()
# Every process of the users has ended before their files are looked at.
for user in "${users[@]}"; do
    for _ in $(seq 100); do pgrep -u "$user" >/dev/null || break; sleep 0.05; done
done
axsign untrust "$work/developer.key.pub" >/dev/null
axsign untrust "$guide_key" >/dev/null
dpkg --purge "${ours[@]}" >"$work/purge.log" 2>&1 || { cat "$work/purge.log"; fail "dpkg --purge failed"; }
listing >"$work/after"
if ! diff -u "$work/before" "$work/after" >"$work/left"; then
    cat "$work/left"
    fail "purging left files behind"
fi
echo "debian-package-test: the packages install, serve ordinary users, and purge cleanly"
