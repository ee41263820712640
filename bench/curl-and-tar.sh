#!/bin/sh
# The public tools' side of the update run's timing: the same work around
# the update as `larder-update-run-timing --run DIR` (a fresh copy of the
# installed 1.0 bundles, larder-store started on loopback), then the 100
# packages fetched with curl one after another and each unpacked with tar
# into a scratch folder.
#
#   curl-and-tar.sh DIR [--one-curl]
#
# DIR is made by `larder-update-run-timing --prepare DIR`. By default each
# package is fetched by a curl process of its own; with --one-curl a single
# curl fetches them all in turn over one connection, which leaves out the
# 100 process starts (the stricter reference). The store program is
# $LARDER_STORE, or larder-store on the PATH.
set -eu
dir=$(cd "$1" && pwd)
mode=${2:-}
store=${LARDER_STORE:-larder-store}
work=$dir/curl-work

rm -rf "$work"
mkdir -p "$work/packages" "$work/unpacked"
cp -R "$dir/pristine" "$work/root"

"$store" --catalogue "$dir/catalogue" --port 0 >"$work/store.out" 2>/dev/null &
store_pid=$!
trap 'kill "$store_pid" 2>/dev/null; wait "$store_pid" 2>/dev/null || true' EXIT
until grep -q '^larder-store listening on ' "$work/store.out"; do
  kill -0 "$store_pid" || exit 1
  sleep 0.01
done
base=$(sed -n 's/^larder-store listening on //p' "$work/store.out")

# Names are cut with the shell's own expansions: a basename process per
# package would be timed with the reference.
set --
for package in "$dir"/catalogue/items/*/*.tar; do
  folder=${package%/*}
  ware=${folder##*/}
  name=${package##*/}
  if [ "$mode" = --one-curl ]; then
    set -- "$@" -o "$work/packages/$ware.tar" "$base/assets/$ware/$name"
  else
    curl -sSf -o "$work/packages/$ware.tar" "$base/assets/$ware/$name"
  fi
done
[ "$#" -eq 0 ] || curl -sSf "$@"

count=0
for package in "$work"/packages/*.tar; do
  ware=${package##*/}
  ware=${ware%.tar}
  mkdir "$work/unpacked/$ware"
  tar -xf "$package" -C "$work/unpacked/$ware"
  count=$((count + 1))
done
[ "$count" -eq 100 ]
