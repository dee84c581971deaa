#!/usr/bin/env bash
# Installs what is missing, builds tavrind and runs it in the foreground on the embedded default:
# every path under one local folder (default ./.tavrin-root, or $TAVRIN_ROOT), no root needed.
# Extra arguments go to tavrind. Ctrl-C stops it.
set -euo pipefail
cd "$(dirname "$0")/.."
./scripts/bootstrap.sh
cmake -S . -B build/release -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
ninja -C build/release tavrind
root="${TAVRIN_ROOT:-$PWD/.tavrin-root}"
mkdir -p "$root"
echo "tavrind: root $root (socket $root/run/reporting.sock)"
exec build/release/tavrind --root "$root" "$@"
