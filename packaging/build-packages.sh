#!/usr/bin/env bash
# Builds tavrin's Debian packages and checks them without installing anything on this machine.
#
# Usage: packaging/build-packages.sh [--skip-build]
#
#   1. a Release build in build/package (CMAKE_INSTALL_PREFIX=/usr, no tests), packed by CPack into
#      build/package/packages/*.deb (docs/packaging.md);
#   2. lintian on every package: errors fail, warnings are listed;
#   3. every package unpacked (dpkg -x) into a scratch root, whose files and modes, sysusers.d
#      user, tmpfiles.d directories (created by systemd-sysusers/systemd-tmpfiles --root in the
#      scratch root only) and units (systemd-analyze verify) are checked;
#   4. the unpacked tavrind started from its installed path with --root on a temporary directory
#      and the installed example settings, and the unpacked tavrinctl asked for its reporters and
#      to record a session.
# Prints PASS or FAIL per check and exits 1 when any check failed.
#
# Needs, besides what scripts/bootstrap.sh installs: dpkg-dev (dpkg-shlibdeps), file, fakeroot and
# lintian. Those missing are installed with apt-get (as root, or through sudo) on the first run.
# --skip-build packs and checks an existing build/package.
set -euo pipefail
cd "$(dirname "$0")/.."
source_dir=$PWD
build=$source_dir/build/package
skip_build=0
for arg in "$@"; do
  case $arg in
    --skip-build) skip_build=1 ;;
    -h | --help)
      sed -n '2,/^set -euo/p' "$0" | sed '$d; s/^# \{0,1\}//'
      exit 0
      ;;
    *)
      echo "unknown argument: $arg (see --help)" >&2
      exit 2
      ;;
  esac
done

failures=0
pass() { printf 'PASS  %s\n' "$*"; }
fail() {
  printf 'FAIL  %s\n' "$*"
  failures=$((failures + 1))
}
check() { # check DESCRIPTION COMMAND...: PASS when the command succeeds
  local what=$1
  shift
  if "$@" >/dev/null 2>&1; then pass "$what"; else fail "$what"; fi
}

# --- tools this script alone needs ---
need=()
for tool in dpkg-shlibdeps:dpkg-dev file:file fakeroot:fakeroot lintian:lintian; do
  command -v "${tool%%:*}" >/dev/null || need+=("${tool#*:}")
done
if [ ${#need[@]} -gt 0 ]; then
  sudo=""
  [ "$(id -u)" -ne 0 ] && sudo=sudo
  echo "build-packages: installing ${need[*]}"
  $sudo apt-get update -qq
  DEBIAN_FRONTEND=noninteractive $sudo apt-get install -y -qq --no-install-recommends "${need[@]}" \
    >/dev/null
fi

# --- 1. build and pack ---
if [ "$skip_build" -eq 0 ]; then
  launcher=()
  command -v ccache >/dev/null && launcher=(-DCMAKE_CXX_COMPILER_LAUNCHER=ccache)
  # -O2 as Debian builds (g++ 12 at -O3 warns falsely in std::string, and warnings are errors);
  # Debian's hardening: fortified libc calls, read-only relocations, immediate binding.
  cmake -S "$source_dir" -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=Release \
    "-DCMAKE_CXX_FLAGS_RELEASE=-O2 -DNDEBUG" \
    -DCMAKE_INSTALL_PREFIX=/usr -DTAVRIN_BUILD_TESTS=OFF -DTAVRIN_BUILD_BENCH=OFF \
    -DTAVRIN_WERROR=ON "${launcher[@]}" "-DCMAKE_CXX_FLAGS=-D_FORTIFY_SOURCE=2" \
    "-DCMAKE_EXE_LINKER_FLAGS=-Wl,-z,relro,-z,now" \
    "-DCMAKE_SHARED_LINKER_FLAGS=-Wl,-z,relro,-z,now" >"$build.configure.log" 2>&1 ||
    { cat "$build.configure.log"; exit 1; }
  ninja -C "$build" -j2 tavrind tavrinctl tavrin tavrin-pw-exporter >"$build.ninja.log" 2>&1 ||
    { tail -50 "$build.ninja.log"; exit 1; }
fi
rm -rf "$build/packages"
if (cd "$build" && fakeroot cpack -G DEB -B "$build/packages") >"$build.cpack.log" 2>&1; then
  pass "cpack made the packages"
else
  cat "$build.cpack.log"
  fail "cpack made the packages"
  exit 1
fi
debs=("$build"/packages/*.deb)
for package in tavrind tavrinctl libtavrin libtavrin-dev tavrin-pw-exporter; do
  check "package $package exists" test -f "$(ls "$build"/packages/"${package}"_*.deb 2>/dev/null)"
done

# --- 2. lintian ---
for deb in "${debs[@]}"; do
  name=$(basename "$deb")
  report=$(lintian --no-tag-display-limit "$deb" 2>&1 || true)
  errors=$(printf '%s\n' "$report" | grep -c '^E:' || true)
  warnings=$(printf '%s\n' "$report" | grep '^W:' || true)
  if [ "$errors" -eq 0 ]; then pass "lintian $name: no errors"; else fail "lintian $name: $errors errors"; fi
  printf '%s\n' "$report" | grep '^E:' | sed 's/^/      /' || true
  [ -n "$warnings" ] && printf '%s\n' "$warnings" | sed 's/^/      /'
done

# --- 3. the unpacked tree ---
scratch=$(mktemp -d "${TMPDIR:-/tmp}/tavrin-packages-XXXXXX")
service_pid=
cleanup() {
  if [ -n "$service_pid" ]; then kill -KILL "$service_pid" 2>/dev/null || true; fi
  rm -rf "$scratch"
}
trap cleanup EXIT
root=$scratch/root
mkdir -p "$root"
for deb in "${debs[@]}"; do dpkg-deb -x "$deb" "$root"; done
multiarch=$(dpkg-architecture -qDEB_HOST_MULTIARCH 2>/dev/null || gcc -print-multiarch)

mode_is() { # mode_is MODE PATH
  [ "$(stat -c %a "$2")" = "$1" ]
}
for entry in 755:usr/sbin/tavrind 755:usr/bin/tavrinctl 755:usr/bin/tavrin-pw-exporter \
  644:usr/lib/systemd/system/tavrind.service 644:usr/lib/systemd/system/tavrind.socket \
  644:usr/lib/sysusers.d/tavrin.conf 644:usr/lib/tmpfiles.d/tavrin.conf \
  644:etc/tavrin/com.quorvex.tavrin.toml 644:usr/include/tavrin/Client.h \
  644:usr/lib/$multiarch/pkgconfig/tavrin.pc 644:usr/lib/$multiarch/cmake/tavrin/tavrinConfig.cmake \
  644:usr/share/doc/tavrind/copyright 644:usr/share/doc/tavrind/README.md; do
  check "file /${entry#*:} mode ${entry%%:*}" mode_is "${entry%%:*}" "$root/${entry#*:}"
done
check "libtavrin.so.0 is in libtavrin, its .so link in libtavrin-dev" bash -c "
  dpkg-deb -c $build/packages/libtavrin_*.deb | grep -q 'libtavrin\.so\.0 ' &&
  ! dpkg-deb -c $build/packages/libtavrin_*.deb | grep -q 'libtavrin\.so -> \|include/\|pkgconfig\|cmake/' &&
  dpkg-deb -c $build/packages/libtavrin-dev_*.deb | grep -q 'libtavrin\.so -> '"
check "the example settings are a conffile of tavrind" bash -c \
  "dpkg-deb -I $build/packages/tavrind_*.deb conffiles | grep -qx /etc/tavrin/com.quorvex.tavrin.toml"
check "tavrind has postinst, prerm and postrm" bash -c \
  "for s in postinst prerm postrm; do dpkg-deb -I $build/packages/tavrind_*.deb \$s | head -1 | grep -q '^#!/bin/sh'; done"
check "tavrinctl depends on libtavrin" bash -c \
  "dpkg-deb -f $build/packages/tavrinctl_*.deb Depends | grep -q 'libtavrin (='"

# The user and the directories, made inside the scratch root by the tools the postinst runs.
check "sysusers.d declares user tavrin (home /var/lib/tavrin, no login)" grep -Eq \
  '^u tavrin - ".*" /var/lib/tavrin /usr/sbin/nologin$' "$root/usr/lib/sysusers.d/tavrin.conf"
mkdir -p "$root/etc"
touch "$root/etc/passwd" "$root/etc/group" "$root/etc/shadow" "$root/etc/gshadow"
if systemd-sysusers --root="$root" tavrin.conf >"$scratch/sysusers.log" 2>&1 &&
  grep -Eq '^tavrin:x:[0-9]+:[0-9]+:.*:/var/lib/tavrin:/usr/sbin/nologin$' "$root/etc/passwd" &&
  grep -Eq '^tavrin:x:[0-9]+:' "$root/etc/group"; then
  pass "systemd-sysusers --root creates user and group tavrin"
else
  cat "$scratch/sysusers.log"
  fail "systemd-sysusers --root creates user and group tavrin"
fi
uid=$(awk -F: '$1 == "tavrin" { print $3 }' "$root/etc/passwd")
gid=$(awk -F: '$1 == "tavrin" { print $3 }' "$root/etc/group")
if systemd-tmpfiles --root="$root" --create tavrin.conf >"$scratch/tmpfiles.log" 2>&1; then
  pass "systemd-tmpfiles --root creates the directories"
else
  cat "$scratch/tmpfiles.log"
  fail "systemd-tmpfiles --root creates the directories"
fi
owned() { # owned MODE UID GID PATH
  [ "$(stat -c '%a %u %g' "$4")" = "$1 $2 $3" ]
}
for entry in "750 $uid $gid var/lib/tavrin" "750 $uid $gid var/log/tavrin" \
  "750 $uid $gid var/log/tavrin/DiagnosticLogs/Audio/Reporting" "755 $uid $gid run/tavrin" \
  "775 0 $gid run/tavrin/driverstats"; do
  read -r mode owner group dir <<<"$entry"
  check "directory /$dir mode $mode owner $owner:$group" owned "$mode" "$owner" "$group" "$root/$dir"
done

if command -v systemd-analyze >/dev/null; then
  # Offline: the units as installed, the binary at its installed path inside the scratch root.
  # The scratch root holds only these packages: /bin/kill (ExecReload) comes from procps.
  systemd-analyze verify --man=no --recursive-errors=no --root="$root" \
    /usr/lib/systemd/system/tavrind.socket /usr/lib/systemd/system/tavrind.service \
    >"$scratch/verify.log" 2>&1 || true
  if ! grep -v 'Command /bin/kill is not executable' "$scratch/verify.log" | grep -q .; then
    pass "systemd-analyze verify: tavrind.socket and tavrind.service"
  else
    sed 's/^/      /' "$scratch/verify.log"
    fail "systemd-analyze verify: tavrind.socket and tavrind.service"
  fi
else
  echo "SKIP  systemd-analyze verify (systemd-analyze not installed)"
fi

# --- 4. the unpacked programs run ---
run=$scratch/run
export LD_LIBRARY_PATH=$root/usr/lib/$multiarch
"$root/usr/sbin/tavrind" --root "$run" --defaults "$root/etc/tavrin/com.quorvex.tavrin.toml" \
  >"$scratch/tavrind.log" 2>&1 &
service_pid=$!
for _ in $(seq 100); do
  [ -S "$run/run/reporting.sock" ] && break
  sleep 0.1
done
ctl() { TAVRIN_ROOT=$run "$root/usr/bin/tavrinctl" "$@"; }
check "installed tavrind listens on $run/run/reporting.sock" test -S "$run/run/reporting.sock"
check "installed tavrinctl reporters answers" ctl reporters
if printf '{"route": "speaker"}\n' | ctl record --service-type telephony \
  --configuration '{"HostApplicationDisplayID": "package-check"}' >"$scratch/record.log" 2>&1 &&
  ctl events --table session_messages | grep -q '"route":"speaker"'; then
  pass "installed tavrinctl records a session the store keeps"
else
  cat "$scratch/record.log"
  fail "installed tavrinctl records a session the store keeps"
fi
check "tavrind logged no error about the installed settings" bash -c \
  "! grep -i 'com.quorvex.tavrin.toml' $scratch/tavrind.log | grep -qi 'error\|fail'"
kill -TERM "$service_pid"
status=0
wait "$service_pid" || status=$?
service_pid=
if [ "$status" -eq 0 ]; then pass "installed tavrind exits 0 on SIGTERM"; else
  sed 's/^/      /' "$scratch/tavrind.log" | tail -20
  fail "installed tavrind exits 0 on SIGTERM (status $status)"
fi

echo
stat -c '      %s  %n' "${debs[@]}"
if [ "$failures" -eq 0 ]; then
  echo "build-packages: all checks passed"
else
  echo "build-packages: $failures checks failed"
  exit 1
fi
