#!/usr/bin/env bash
# A user-started install of one 50 MiB update, as a whole process, against
# fetching the same package with curl and unpacking it with tar, interleaved
# in one run on the same machine.
#
#   user-install-vs-curl.sh [--runs N] [--keep] [--bin DIR]
#
# Under a temporary folder: a private session bus, larder-store on loopback
# with one item whose 2.0 package holds 50 MiB of random bytes and a
# program that sleeps, the installed 1.0 bundle (with its purchase record)
# under a platform root of its own, larderd pointed at the store, a sign-in,
# an update check and `larderctl agent --answer ok`, which agrees to the
# quit dialog.
#
# Each round times, with the shell's clock around the command only:
#   A  `larderctl install ITEM`: the quit of the running 1.0 app, the
#      purchase, the download with its chunk digests, the install and the
#      relaunch; it counts only when it printed "updated Notes to 2.0", the
#      bundle reads 2.0 and a 2.0 app process runs again;
#   B  `curl -sSf -o FILE URL` of the same package, then `tar -xf FILE`
#      into an empty folder; it counts only when the 50 MiB came out whole.
# Before every A, outside the timing, the app is stopped, the 1.0 bundle
# put back, the app started again and the update checked for until the
# service knows it. The order of A and B alternates from round to round, and
# one round of each is run first as a warm-up, not counted. At the end it
# prints each pair, the medians and the ratios, and each A cut into its
# steps by the lines of larderd's log.
#
# --runs N   counted rounds (default 7, at least 5)
# --keep     leave the temporary folder (larderd's log with the time each
#            line was read, every command's output) and print its path
# --bin DIR  where larderd, larderctl and larder-store are (default: the
#            build folder beside this script)
set -euo pipefail
shopt -s inherit_errexit

runs=7
keep=0
bin=$(cd "$(dirname "$0")/.." && pwd)/build
while [ $# -gt 0 ]; do
  case $1 in
    --runs) runs=$2; shift 2 ;;
    --keep) keep=1; shift ;;
    --bin) bin=$(cd "$2" && pwd); shift 2 ;;
    *) echo "usage: $0 [--runs N] [--keep] [--bin DIR]" >&2; exit 2 ;;
  esac
done
[ "$runs" -ge 5 ] || { echo "$0: --runs must be at least 5" >&2; exit 2; }
for program in larderd larderctl larder-store; do
  [ -x "$bin/$program" ] || { echo "$0: no $bin/$program" >&2; exit 2; }
done
# The clock is read by the shell itself: a date process before and after
# each command would be timed with it.
[ -n "${EPOCHREALTIME:-}" ] || { echo "$0: needs bash 5 (EPOCHREALTIME)" >&2; exit 2; }

readonly ware=61101
readonly account=bench@example.com
readonly password=pw
readonly payload_bytes=$((50 * 1024 * 1024))
# Running applications are found machine-wide by identifier: one of our own
# keeps other benchmarks' and tests' apps out of our counts and kills.
readonly bundle_id=com.example.bench.userinstall.$$

work=$(mktemp -d "${TMPDIR:-/tmp}/larder-user-install.XXXXXX")
readonly work
readonly app=$work/root/Applications/Notes.app
bus_pid='' store_pid='' service_pid='' agent_pid='' first_pid=''

stop_pid() {
  [ -n "$1" ] || return 0
  kill "$1" 2>/dev/null || true
  wait "$1" 2>/dev/null || true
}
cleanup() {
  local pid
  for pid in $(app_pids); do kill -KILL "$pid" 2>/dev/null || true; done
  stop_pid "$agent_pid"
  stop_pid "$service_pid"
  stop_pid "$store_pid"
  [ -z "$bus_pid" ] || kill "$bus_pid" 2>/dev/null || true
  if [ "$keep" = 1 ]; then
    echo "kept: $work" >&2
  else
    rm -rf "$work"
  fi
}
trap cleanup EXIT

fail() {
  echo "$0: $*" >&2
  exit 1
}

# Waits up to $1 seconds for the command that follows to succeed.
wait_until() {
  local deadline=$((SECONDS + $1))
  shift
  until "$@"; do
    [ "$SECONDS" -lt "$deadline" ] || return 1
    sleep 0.02
  done
}

plist() {
  printf '<?xml version="1.0" encoding="UTF-8"?>\n<plist version="1.0">\n%s\n</plist>\n' "$1"
}

# "<folder>/Notes.app" at version $2: a program that runs the shell and
# sleep copied into the bundle from where it is installed ($app), as the
# running applications see a process of the bundle, and $3 random bytes.
write_bundle() {
  local bundle=$1/Notes.app version=$2 bytes=$3
  mkdir -p "$bundle/bin"
  plist "<dict>
<key>HostBundleIdentifier</key><string>$bundle_id</string>
<key>HostBundleShortVersionString</key><string>$version</string>
<key>HostBundleVersion</key><string>$version</string>
<key>HostBundleExecutable</key><string>Notes</string>
</dict>" >"$bundle/bundle.plist"
  plist "<dict>
<key>bundleIdentifier</key><string>$bundle_id</string>
<key>bundleVersion</key><string>$version</string>
<key>wareID</key><integer>$ware</integer>
<key>installerVersionID</key><integer>1</integer>
<key>opaqueAccountIDString</key><string>account-1</string>
<key>purchaseDate</key><date>2023-11-14T22:13:20Z</date>
</dict>" >"$bundle/purchase.plist"
  cp /bin/sh /bin/sleep "$bundle/bin/"
  printf '#!%s/bin/sh\nexec %s/bin/sleep 600\n' "$app" "$app" >"$bundle/bin/Notes"
  chmod 700 "$bundle/bin/Notes"
  head -c "$bytes" /dev/urandom >"$bundle/payload.bin"
}

# The processes that run from the installed bundle.
app_pids() {
  local entry exe
  for entry in /proc/[0-9]*; do
    exe=$(readlink "$entry/exe" 2>/dev/null) || continue
    case $exe in "$app"/*) echo "${entry#/proc/}" ;; esac
  done
}

# The installed bundle.plist may have been written on one line or many.
bundle_version() {
  tr -d '\n\t ' <"$app/bundle.plist" 2>/dev/null |
    sed -n 's:.*<key>HostBundleShortVersionString</key><string>\([^<]*\)</string>.*:\1:p'
}

service_serving() {
  dbus-send --session --print-reply --dest=org.freedesktop.DBus /org/freedesktop/DBus \
    org.freedesktop.DBus.NameHasOwner string:com.orvane.larderd 2>/dev/null | grep -q 'boolean true'
}

lctl() {
  "$bin/larderctl" "$@"
}

# --- the machine ------------------------------------------------------------

mkdir -p "$work/root/Applications" "$work/home/Applications" "$work/home/.cache" \
  "$work/home/.local/state" "$work/home/.config" "$work/catalogue/items/$ware" \
  "$work/packed" "$work/pristine" "$work/logs"

plist "<array><dict>
<key>accountID</key><integer>1</integer>
<key>orvaneID</key><string>$account</string>
<key>password</key><string>$password</string>
<key>storeFrontID</key><string>143441</string>
<key>opaqueID</key><string>account-1</string>
</dict></array>" >"$work/catalogue/accounts.plist"
plist "<dict>
<key>ware-id</key><integer>$ware</integer>
<key>bundle-id</key><string>$bundle_id</string>
<key>title</key><string>Notes</string>
<key>version</key><string>2.0</string>
<key>release-date</key><date>2023-11-14T22:13:20Z</date>
<key>package</key><string>Notes.tar</string>
<key>action-params</key><string>itemId=$ware</string>
</dict>" >"$work/catalogue/items/$ware/item.plist"
write_bundle "$work/packed" 2.0 "$payload_bytes"
"$bin/larder-store" pack "$work/packed/Notes.app" "$work/catalogue/items/$ware/Notes.tar"
rm -rf "$work/packed"
write_bundle "$work/pristine" 1.0 4096

{
  read -r bus_address
  read -r bus_pid
} < <(dbus-daemon --session --fork --nopidfile --print-address=1 --print-pid=1)
export DBUS_SESSION_BUS_ADDRESS=$bus_address
export HOME=$work/home LARDER_ROOT=$work/root
export XDG_CACHE_HOME=$work/home/.cache XDG_STATE_HOME=$work/home/.local/state
export XDG_CONFIG_HOME=$work/home/.config

"$bin/larder-store" --catalogue "$work/catalogue" --port 0 \
  >"$work/logs/store.out" 2>"$work/logs/store.err" &
store_pid=$!
wait_until 20 grep -q '^larder-store listening on ' "$work/logs/store.out" ||
  fail "larder-store did not start: $(cat "$work/logs/store.err")"
base=$(sed -n 's/^larder-store listening on //p' "$work/logs/store.out")
readonly url=$base/assets/$ware/Notes.tar

# Each line of the service's log with the time it was read, so that a run
# can be cut into its steps afterwards; the service logs at its default
# level.
LARDER_STORE_URL=$base/bag.plist "$bin/larderd" 2> >(
  while IFS= read -r line; do printf '%s %s\n' "$EPOCHREALTIME" "$line"; done \
    >"$work/logs/larderd.log"
) &
service_pid=$!
# Serving on the bus, and its first look at the disk done.
wait_until 20 service_serving || fail "larderd did not serve on the bus"
wait_until 20 grep -qs 'Software map rebuild took' "$work/logs/larderd.log" ||
  fail "larderd did not look at the disk"

lctl signin "$account" --password "$password" >"$work/logs/signin.out"
lctl agent --answer ok >"$work/logs/agent.out" 2>"$work/logs/agent.err" &
agent_pid=$!
wait_until 20 grep -qs registered "$work/logs/agent.err" || fail "the agent did not register"

# --- the two commands -------------------------------------------------------

# Back to the state before a user-started install: the 1.0 bundle, its app
# running, the update known to the service.
reset_to_installed() {
  local pid
  for pid in $(app_pids); do kill -KILL "$pid" 2>/dev/null || true; done
  wait_until 10 no_app || fail "the app did not stop"
  rm -rf "$app"
  cp -a "$work/pristine/Notes.app" "$app"
  "$app/bin/Notes" </dev/null >/dev/null 2>&1 &
  first_pid=$!
  wait_until 10 first_app_runs || fail "the 1.0 app did not start"
  # The service's live query sees the 1.0 bundle a little after the copy;
  # until then a check finds nothing to update.
  wait_until 30 update_known || fail "the service did not learn of the update again"
}
no_app() {
  [ -z "$(app_pids)" ]
}
first_app_runs() {
  [ "$(readlink "/proc/$first_pid/exe" 2>/dev/null)" = "$app/bin/sleep" ]
}
update_known() {
  lctl updates --check >"$work/logs/check.out" 2>&1 &&
    grep -q "$ware\|Notes" "$work/logs/check.out"
}

# A: prints the seconds, or fails with what went wrong.
time_install() {
  local out=$work/logs/install-$1 start end pid relaunched=''
  sync -f "$work"
  start=$EPOCHREALTIME
  if ! lctl install "$ware" >"$out.out" 2>"$out.err"; then
    echo "install $1 failed: $(cat "$out.err")" >&2
    return 1
  fi
  end=$EPOCHREALTIME
  grep -q '^updated Notes to 2.0$' "$out.out" || { echo "install $1 printed: $(cat "$out.out")" >&2; return 1; }
  [ "$(bundle_version)" = 2.0 ] || { echo "install $1: the bundle is not at 2.0" >&2; return 1; }
  # The relaunched app: a process of the bundle other than the quit one.
  # It is looked for once at once; a later find is reported, not hidden.
  for pid in $(app_pids); do [ "$pid" = "$first_pid" ] || relaunched=$pid; done
  if [ -z "$relaunched" ]; then
    local waited=$EPOCHREALTIME
    wait_until 10 relaunched_app || { echo "install $1: the 2.0 app did not run again" >&2; return 1; }
    echo "install $1: the app ran again $(awk -v a="$waited" -v b="$EPOCHREALTIME" 'BEGIN{printf "%.3f", b-a}') s after larderctl returned" >&2
  fi
  echo "$start $end" >"$out.times"
  awk -v a="$start" -v b="$end" 'BEGIN{printf "%.3f\n", b-a}'
}
relaunched_app() {
  local pid
  for pid in $(app_pids); do [ "$pid" = "$first_pid" ] || return 0; done
  return 1
}

# B: prints the seconds, or fails.
time_curl() {
  local scratch=$work/curl start fetched end size
  rm -rf "$scratch"
  mkdir -p "$scratch/unpacked"
  sync -f "$work"
  start=$EPOCHREALTIME
  curl -sSf -o "$scratch/Notes.tar" "$url"
  fetched=$EPOCHREALTIME
  tar -xf "$scratch/Notes.tar" -C "$scratch/unpacked"
  end=$EPOCHREALTIME
  size=$(stat -c %s "$scratch/unpacked/Notes.app/payload.bin")
  [ "$size" = "$payload_bytes" ] || { echo "curl $1: $size bytes unpacked" >&2; return 1; }
  rm -rf "$scratch"
  awk -v a="$start" -v f="$fetched" -v b="$end" 'BEGIN{printf "%.3f %.3f\n", f-a, b-f}' \
    >"$work/logs/curl-$1.steps"
  awk -v a="$start" -v b="$end" 'BEGIN{printf "%.3f\n", b-a}'
}

# Where an install's time went, from the lines of the service's log read
# between its start and its end: the seconds from the start (or the step
# before) to the first line of each step, and from the last to the end.
readonly steps='Enqueuing UpdateOperation|Asking the user to quit|did terminate|Queued download of|Locked applications|Unlocked applications|Re-launching previously terminated'
readonly step_names='request,rights|run start,pause|dialog,quit|purchase|download,digests|install|run end|relaunch,reply'
install_steps() {
  local times
  read -r -a times <"$work/logs/install-$1.times"
  awk -v s="${times[0]}" -v e="${times[1]}" -v steps="$steps" '
    BEGIN { n = split(steps, marker, "|"); k = 1; last = s }
    $1 >= s && $1 <= e && k <= n && index($0, marker[k]) { took[k] = $1 - last; last = $1; k++ }
    END {
      if (k <= n) { print "not found in the log: " marker[k]; exit }
      took[k] = e - last
      for (i = 1; i <= k; i++) printf "%s%.3f", (i > 1 ? " " : ""), took[i]
      print ""
    }' "$work/logs/larderd.log"
}

median() {
  sort -g | awk '{v[NR] = $1} END {
    if (NR == 0) print "-"; else if (NR % 2) printf "%.3f\n", v[(NR + 1) / 2]; else printf "%.3f\n", (v[NR / 2] + v[NR / 2 + 1]) / 2 }'
}

# --- the rounds -------------------------------------------------------------

echo "package: $(stat -c %s "$work/catalogue/items/$ware/Notes.tar") bytes at $url"
reset_to_installed
echo "warm-up: A $(time_install warmup) s, B $(time_curl warmup) s"

as=() bs=() ratios=() loads=()
for round in $(seq 1 "$runs"); do
  reset_to_installed
  loads+=("$(cut -d' ' -f1-3 /proc/loadavg)")
  if [ $((round % 2)) = 1 ]; then
    a=$(time_install "$round")
    b=$(time_curl "$round")
  else
    b=$(time_curl "$round")
    a=$(time_install "$round")
  fi
  as+=("$a") bs+=("$b")
  ratios+=("$(awk -v a="$a" -v b="$b" 'BEGIN{printf "%.2f", a/b}')")
  printf 'round %d: A %s s  B %s s  A/B %s  (load %s)\n' \
    "$round" "$a" "$b" "${ratios[-1]}" "${loads[-1]}"
done

median_a=$(printf '%s\n' "${as[@]}" | median)
median_b=$(printf '%s\n' "${bs[@]}" | median)
echo "median A (larderctl install, to the relaunched app): $median_a s"
echo "median B (curl, then tar -xf):                      $median_b s"
echo "median of the pairs' A/B: $(printf '%s\n' "${ratios[@]}" | median)"
echo "A/B of the medians:       $(awk -v a="$median_a" -v b="$median_b" 'BEGIN{printf "%.2f", a/b}')"
awk -v r="$(printf '%s\n' "${ratios[@]}" | median)" 'BEGIN {
  print "bound of 1.5 x on the median of the pairs: " (r <= 1.5 ? "holds" : "NOT met") }'
echo "load average at the end:  $(cut -d' ' -f1-3 /proc/loadavg)"

# The steps of each counted install, and their medians.
echo
echo "steps of A, seconds: ${step_names//|/  }"
for round in $(seq 1 "$runs"); do
  echo "round $round: $(install_steps "$round")"
done | tee "$work/logs/steps"
columns=$(tr '|' '\n' <<<"$step_names" | wc -l)
medians=()
for column in $(seq 2 $((columns + 1))); do
  medians+=("$(grep -v 'not found' "$work/logs/steps" | awk -v c=$((column + 1)) '{print $c}' | median)")
done
echo "medians: ${medians[*]}"
echo "B's two steps, medians: curl $(cat "$work"/logs/curl-[0-9]*.steps | awk '{print $1}' | median) s, tar $(cat "$work"/logs/curl-[0-9]*.steps | awk '{print $2}' | median) s"
