#!/usr/bin/env bash
# Installs what is missing, builds, and shows the service at work: larderd
# on a private bus over a temporary platform with sample bundles, asked by
# larderctl. Usage: scripts/demo.sh [build-dir]
set -euo pipefail
cd "$(dirname "$0")/.."
build=${1:-build}
if [ -z "${LARDER_DEMO_ON_BUS:-}" ]; then
  ./scripts/install-deps.sh
  cmake -S . -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
  cmake --build "$build" -j"$(nproc)" --target larderd larderctl larder-store
  exec env LARDER_DEMO_ON_BUS=1 dbus-run-session -- "$0" "$build"
fi

larderd="$PWD/$build/larderd"
larderctl="$PWD/$build/larderctl"
larder_store="$PWD/$build/larder-store"
demo=$(mktemp -d /tmp/larder-demo-XXXXXX)
export LARDER_ROOT="$demo/root" HOME="$demo/home"
export XDG_CACHE_HOME="$HOME/.cache" XDG_STATE_HOME="$HOME/.local/state"
export XDG_CONFIG_HOME="$HOME/.config"
mkdir -p "$LARDER_ROOT/Applications" "$HOME/Applications"

plist_header='<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0">'

# bundle FOLDER NAME IDENTIFIER VERSION [ITEM-ID [VERSION-ID]]
bundle() {
  local path="$1/$2.app"
  mkdir -p "$path/resources" "$path/bin"
  cat >"$path/bundle.plist" <<PLIST
$plist_header
<dict>
  <key>HostBundleIdentifier</key><string>$3</string>
  <key>HostBundleShortVersionString</key><string>$4</string>
  <key>HostBundleVersion</key><string>$4</string>
  <key>HostBundleExecutable</key><string>$2</string>
</dict>
</plist>
PLIST
  [ -n "${5:-}" ] && purchase "$path" "$3" "$4" "$5" "${6:-1}"
  return 0
}

# purchase BUNDLE IDENTIFIER VERSION ITEM-ID [VERSION-ID]
purchase() {
  cat >"$1/purchase.plist" <<PLIST
$plist_header
<dict>
  <key>bundleIdentifier</key><string>$2</string>
  <key>bundleVersion</key><string>$3</string>
  <key>wareID</key><integer>$4</integer>
  <key>installerVersionID</key><integer>${5:-1}</integer>
  <key>opaqueAccountIDString</key><string>demo-account</string>
  <key>purchaseDate</key><date>2026-01-15T10:00:00Z</date>
</dict>
</plist>
PLIST
}

bundle "$LARDER_ROOT/Applications" "Ledgerly" com.example.ledgerly 2.4 400100
bundle "$LARDER_ROOT/Applications" "Sketchpad" com.example.sketchpad 1.9 400200
bundle "$HOME/Applications" "Sketchpad" com.example.sketchpad 1.10 400200
bundle "$LARDER_ROOT/Applications" "Terminal Helper" com.example.helper 1.0

# A store with one account and three apps, each packed from a bundle: Atlas
# to buy, and updates for Ledgerly and (one this machine cannot take) for
# Sketchpad.
catalogue="$demo/catalogue"
mkdir -p "$catalogue"
cat >"$catalogue/accounts.plist" <<PLIST
$plist_header
<array><dict>
  <key>accountID</key><integer>5150</integer>
  <key>orvaneID</key><string>demo@example.org</string>
  <key>password</key><string>demo</string>
  <key>opaqueID</key><string>demo-account</string>
</dict></array>
</plist>
PLIST

# store_item ITEM-ID NAME IDENTIFIER VERSION [EXTRA-PLIST-ENTRIES]
store_item() {
  local folder="$catalogue/items/$1"
  mkdir -p "$folder"
  bundle "$demo/packaging" "$2" "$3" "$4" "$1"
  "$larder_store" pack "$demo/packaging/$2.app" "$folder/$2.tar"
  cat >"$folder/item.plist" <<PLIST
$plist_header
<dict>
  <key>ware-id</key><integer>$1</integer>
  <key>bundle-id</key><string>$3</string>
  <key>title</key><string>$2</string>
  <key>version</key><string>$4</string>
  <key>action-params</key><string>itemId=$1&amp;price=0</string>
  <key>release-date</key><date>2026-10-01T09:00:00Z</date>
  <key>package</key><string>$2.tar</string>
  ${5:-}
</dict>
</plist>
PLIST
}
store_item 400400 Atlas com.example.atlas 1.0
store_item 400100 Ledgerly com.example.ledgerly 2.6
store_item 400200 Sketchpad com.example.sketchpad 2.0 "<key>incompatible</key><true/>"

mkdir -p "$XDG_STATE_HOME"
# A desktop's notification server on a virtual screen, where the machine has
# one: the service's notifications then appear there (LARDER_DEMO_SCREENSHOT
# names a PNG file to take of that screen). Without one they are only kept
# in the service's list.
notification_server=
if command -v Xvfb >/dev/null && command -v dunst >/dev/null; then
  display=":$((90 + RANDOM % 100))"
  Xvfb "$display" -screen 0 1024x600x24 -nolisten tcp >/dev/null 2>&1 &
  xserver=$!
  sleep 0.5
  DISPLAY="$display" dunst >/dev/null 2>&1 &
  notification_server="$xserver $!"
  echo "== a notification server (dunst) shows notifications on the virtual screen $display"
fi
echo "== starting larder-store (log: $XDG_STATE_HOME/larder-store.log)"
"$larder_store" --catalogue "$catalogue" --port 0 >"$demo/store.out" 2>"$XDG_STATE_HOME/larder-store.log" &
store=$!
for _ in $(seq 50); do
  grep -q listening "$demo/store.out" 2>/dev/null && break
  sleep 0.1
done
export LARDER_STORE_URL="$(sed -n 's/.*listening on //p' "$demo/store.out")/bag.plist"

echo "== starting larderd (log: $XDG_STATE_HOME/larderd.log)"
"$larderd" 2>"$XDG_STATE_HOME/larderd.log" &
service=$!
trap 'kill $service $store $notification_server 2>/dev/null; rm -rf "$demo"' EXIT
for _ in $(seq 50); do
  "$larderctl" products >/dev/null 2>&1 && break
  sleep 0.1
done
sleep 0.5  # let the first scan and the live queries settle

echo; echo "== larderctl products  (Terminal Helper has no purchase record: not store software)"
"$larderctl" products
echo; echo "== larderctl product --bundle-id com.example.sketchpad  (1.10 is newer than 1.9)"
"$larderctl" product --bundle-id com.example.sketchpad
echo; echo "== larderctl product --item-id 400100 --json"
"$larderctl" product --item-id 400100 --json

echo; echo "== larderctl watch, while Ledgerly is replaced by an announced update (quiet), Newcomer is copied in and its purchase record changed, and Sketchpad's older copy deleted"
"$larderctl" watch &
watcher=$!
sleep 0.3
ledgerly="$LARDER_ROOT/Applications/Ledgerly.app"
"$larderctl" call ProductAtPathWillBeUpdatedToBundleVersionStoreVersion "$ledgerly" 2.5 2
# The install machinery replaces the whole bundle.
bundle "$demo" "Ledgerly" com.example.ledgerly 2.5 400100 2
rm -rf "$ledgerly" && mv "$demo/Ledgerly.app" "$ledgerly"
sleep 0.5  # the index sees the old bundle go and the new one come: announced, so not told
"$larderctl" call ProductAtPathWasUpdatedToBundleVersionStoreVersion "$ledgerly" true 2.5 2
bundle "$demo" "Newcomer" com.example.newcomer 3.0 400300
mv "$demo/Newcomer.app" "$LARDER_ROOT/Applications/"
sleep 0.5
purchase "$LARDER_ROOT/Applications/Newcomer.app" com.example.newcomer 3.0 400300 7
sleep 0.5
rm -rf "$LARDER_ROOT/Applications/Sketchpad.app"
sleep 0.5
kill -INT $watcher
wait $watcher || true
echo; echo "== larderctl products"
"$larderctl" products

echo; echo "== larderctl dialog  (no dialog agent is registered: the dialog counts as cancelled, 0)"
"$larderctl" dialog --message "Install updates now?" --ok Install --cancel Later
echo; echo "== larderctl purchase 400400, while larderctl agent answers the sign-in dialog"
"$larderctl" agent --answer ok --account demo@example.org --password demo --count 1 &
agent=$!
sleep 0.3
"$larderctl" purchase 400400
wait $agent || true
"$larderctl" account
for _ in $(seq 50); do
  [ -e "$LARDER_ROOT/Applications/Atlas.app/purchase.plist" ] && break
  sleep 0.1
done
sleep 0.5  # the live query sees the new bundle
echo; echo "== larderctl product --bundle-id com.example.atlas  (downloaded, digests checked, installed)"
"$larderctl" product --bundle-id com.example.atlas

echo; echo "== larderctl updates --check  (Ledgerly 2.5 installed, 2.6 in the store; Sketchpad 2.0 needs another machine)"
"$larderctl" updates --check
echo; echo "== larderctl updates  (the same list, from the service's cache; no store request)"
"$larderctl" updates

# The OS updates the system offers this machine, in the simulated system
# update framework.
mkdir -p "$LARDER_ROOT/var/lib/larder-platform"
cat >"$LARDER_ROOT/var/lib/larder-platform/system-updates.plist" <<PLIST
$plist_header
<dict><key>catalog</key><array>
  <dict><key>productKey</key><string>SEC-2026-11</string><key>title</key><string>Security Update</string>
    <key>versionString</key><string>2026-11</string><key>isCritical</key><true/>
    <key>isRecommended</key><true/><key>downloadSize</key><integer>52428800</integer></dict>
  <dict><key>productKey</key><string>KERNEL-6.12</string><key>title</key><string>Kernel</string>
    <key>versionString</key><string>6.12.4</string><key>isRecommended</key><true/>
    <key>restartRequired</key><true/><key>allowedToUseInstallLater</key><true/></dict>
</array><key>scanSeconds</key><real>1.5</real></dict>
</plist>
PLIST

echo; echo "== larderctl watch --badge, while larderctl os-updates --scan scans for OS updates (progress on a terminal)"
"$larderctl" watch --badge &
badge_watcher=$!
sleep 0.3
"$larderctl" os-updates --scan
echo; echo "== larderctl badge  (one app update, plus one for all OS updates together)"
"$larderctl" badge
echo; echo "== larderctl os-updates --hide KERNEL-6.12"
"$larderctl" os-updates --hide KERNEL-6.12
echo; echo "== larderctl background-scan  (the daily agent's report: the service enqueues one run, see its log)"
"$larderctl" background-scan
sleep 0.3
grep -o 'Enqueuing UpdateOperation.*' "$XDG_STATE_HOME/larderd.log" | tail -1
"$larderctl" os-updates --unhide-all >/dev/null
sleep 0.3
kill -INT $badge_watcher
wait $badge_watcher || true

# background_run: the agent's report, as if the intervals had passed since
# the last run, and the wait for the end of the run it starts.
background_run() {
  local before
  before=$(grep -c 'autoupdate.operation_run' "$XDG_STATE_HOME/larderd.log" || true)
  "$larderctl" prefs delete com.orvane.larderd DidStageAppUpdatesDate >/dev/null || true
  "$larderctl" prefs delete com.orvane.larderd DidStartAutoUpdateDate >/dev/null || true
  "$larderctl" background-scan >/dev/null
  for _ in $(seq 300); do
    [ "$(grep -c 'autoupdate.operation_run' "$XDG_STATE_HOME/larderd.log")" -gt "$before" ] && break
    sleep 0.1
  done
}

# Ledgerly becomes a program that runs from inside its bundle.
cp /bin/sh /bin/sleep "$ledgerly/bin/"
printf '#!%s/bin/sh\nexec %s/bin/sleep 600\n' "$ledgerly" "$ledgerly" >"$ledgerly/bin/Ledgerly"
chmod +x "$ledgerly/bin/Ledgerly"
"$larderctl" prefs set com.orvane.larderd AutoUpdateEnabled true --type bool
"$ledgerly/bin/Ledgerly" &
ledgerly_app=$!
trap 'kill $service $store $ledgerly_app $notification_server 2>/dev/null; rm -rf "$demo"' EXIT
sleep 0.3
echo; echo "== automatic updates on, Ledgerly running: a background run stages its update and holds it back"
background_run
"$larderctl" runs
echo; echo "== larderctl updates  (staged; abort code 3: the app is running)"
"$larderctl" --json updates | grep -o '"autoUpdateAbortCode":[0-9]*\|"isStaged":[a-z]*' | paste -sd' '
echo; echo "== larderctl notifications  (what the runs told the user so far)"
"$larderctl" notifications
if [ -n "${LARDER_DEMO_SCREENSHOT:-}" ] && [ -n "$notification_server" ]; then
  sleep 1  # let the server draw it
  if xwd -root -display "$display" | convert xwd:- "$LARDER_DEMO_SCREENSHOT"; then
    echo "== screenshot of the virtual screen: $LARDER_DEMO_SCREENSHOT"
  else
    echo "== no screenshot: it takes xwd (x11-apps) and convert (imagemagick)"
  fi
fi
kill $ledgerly_app; wait $ledgerly_app 2>/dev/null || true
echo; echo "== Ledgerly has quit: the next background run installs the staged update"
background_run
"$larderctl" runs || true
"$larderctl" product --bundle-id com.example.ledgerly | grep -i version
echo; echo "== larderctl notifications  (and now: the app that was updated automatically)"
"$larderctl" notifications
