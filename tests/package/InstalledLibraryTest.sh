#!/bin/sh
# Installs libtavrin from the build into a temporary prefix, builds the example of docs/example against the
# installed libtavrin twice (CMake package, pkg-config), and runs both against a real tavrind.
# Usage: InstalledLibraryTest.sh BUILD_DIR SOURCE_DIR
set -eu
build_dir=$1
source_dir=$2
work=$(mktemp -d "${TMPDIR:-/tmp}/tavrin-package-XXXXXX")
service=
cleanup() {
  [ -n "$service" ] && kill -KILL "$service" 2>/dev/null || true
  rm -rf "$work"
}
trap cleanup EXIT

cmake --install "$build_dir" --prefix "$work/prefix" --component libtavrin >/dev/null
libdir=$(dirname "$(find "$work/prefix" -name libtavrin.so -print -quit)")
[ -f "$libdir/pkgconfig/tavrin.pc" ] || { echo "no tavrin.pc under $libdir/pkgconfig"; exit 1; }

# As a user would: a copy of the example, built with the installed package only.
cp -r "$source_dir/docs/example" "$work/example"
cmake -S "$work/example" -B "$work/example/build" -G Ninja -DCMAKE_PREFIX_PATH="$work/prefix" \
  >/dev/null
cmake --build "$work/example/build" >/dev/null
PKG_CONFIG_PATH="$libdir/pkgconfig" make -s -C "$work/example" report_xruns render_callback \
  >/dev/null

"$build_dir/tavrind" --root "$work/root" >"$work/tavrind.log" 2>&1 &
service=$!
socket="$work/root/run/reporting.sock"
for _ in $(seq 1 200); do [ -S "$socket" ] && break; sleep 0.05; done
[ -S "$socket" ] || { cat "$work/tavrind.log"; exit 1; }

for program in "$work/example/build/report_xruns" "$work/example/report_xruns"; do
  output=$(LD_LIBRARY_PATH="$libdir" "$program" "$socket")
  echo "$output"
  case "$output" in "reported 4 messages as reporter "*) ;; *) exit 1 ;; esac
done

# The C example: every report of its 20 buffers reaches the service.
for program in "$work/example/build/render_callback" "$work/example/render_callback"; do
  output=$(LD_LIBRARY_PATH="$libdir" "$program" "$socket")
  echo "$output"
  [ "$output" = "rendered 20 buffers, 20 reports sent, 0 dropped" ] || exit 1
done

kill -TERM "$service"
wait "$service"
service=
rows=$(sqlite3 "$work/root/lib/tavrin.db" \
  "SELECT count(*) FROM session_messages WHERE category = 2 AND type = 1")
[ "$rows" = 8 ] || { echo "expected 8 rows from the two runs, found $rows"; exit 1; }
rendered=$(sqlite3 "$work/root/lib/tavrin.db" \
  "SELECT count(*) FROM session_messages WHERE category = 2 AND type = 3")
[ "$rendered" = 40 ] || { echo "expected 40 rows from the C example, found $rendered"; exit 1; }
echo "installed package: CMake and pkg-config builds ran; $rows rows in the store"
