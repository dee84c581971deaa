#!/usr/bin/env bash
# Installs what is missing, builds tavrind and tavrinctl and runs tavrind in the foreground on the
# embedded default: every path under one local folder (default ./.tavrin-root, or $TAVRIN_ROOT),
# no root needed.
# Extra arguments go to tavrind. Ctrl-C stops it.
set -euo pipefail
cd "$(dirname "$0")/.."
./scripts/bootstrap.sh
cmake -S . -B build/release -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
ninja -C build/release tavrind tavrinctl
root="${TAVRIN_ROOT:-$PWD/.tavrin-root}"
mkdir -p "$root/etc"
# A local development root is an internal build: stopped sessions leave summary files.
if [ ! -e "$root/etc/device.toml" ]; then
  printf 'InternalBuild = true\n' >"$root/etc/device.toml"
  echo "tavrind: wrote $root/etc/device.toml (InternalBuild = true)"
fi
echo "tavrind: root $root (socket $root/run/reporting.sock)"
echo "tavrind: client: TAVRIN_ROOT=$root build/release/tools/tavrinctl/tavrinctl --help"
exec build/release/tavrind --root "$root" "$@"
