#!/bin/sh
# Assembles the demo's sample application, Sampler.app with the plug-ins Greeter and Farewell, and
# signs each bundle with the demo key (made once, kept beside the bundles); signs a copy of axd,
# bin/axd, with the two platform entitlements it needs to get plug-ins ready.
#   make-samples.sh AXSIGN SAMPLE_EXECUTABLE SOURCE_DIR OUT_DIR AXD
set -eu
axsign=$1 exe=$2 src=$3 out=$4 axd=$5
app=$out/Sampler.app
rm -rf "$app"
mkdir -p "$app/PlugIns"
install -m 0644 "$src/Sampler-Info.plist" "$app/Info.plist"
install -m 0755 "$exe" "$app/Sampler"
for name in Greeter Farewell; do
    mkdir -p "$app/PlugIns/$name.appex"
    install -m 0644 "$src/$name-Info.plist" "$app/PlugIns/$name.appex/Info.plist"
    install -m 0755 "$exe" "$app/PlugIns/$name.appex/$name"
done
[ -f "$out/demo.key" ] || "$axsign" keygen --out "$out/demo.key" >/dev/null
"$axsign" sign --key "$out/demo.key" "$app" >/dev/null
"$axsign" sign --key "$out/demo.key" "$app/PlugIns/Greeter.appex" >/dev/null
"$axsign" sign --key "$out/demo.key" --entitlements "$src/Farewell-entitlements.plist" \
    "$app/PlugIns/Farewell.appex" >/dev/null
install -m 0755 "$axd" "$out/bin/axd"
"$axsign" sign --key "$out/demo.key" --entitlements "$src/axd-entitlements.plist" "$out/bin/axd" >/dev/null
