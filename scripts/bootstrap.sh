#!/usr/bin/env bash
# Installs every Debian package that building, running and testing tavrin needs.
# Idempotent: packages already present are left as they are. Nothing is fetched from anywhere
# but Debian's own archive.
set -euo pipefail

packages=(
  # toolchain
  g++ cmake ninja-build pkg-config git ccache make
  # tests, benchmarks, formatting
  libgtest-dev libgmock-dev libbenchmark-dev clang-format clang-tidy libmsgpack-cxx-dev
  # the report opened in a real browser (headless), by a Python driver
  chromium python3
  # libraries of the service
  libasio-dev libspdlog-dev libfmt-dev libsystemd-dev systemtap-sdt-dev libtomlplusplus-dev
  nlohmann-json3-dev libsqlite3-dev sqlite3 librdkafka-dev libsdbus-c++-dev libcli11-dev
  # line editing and history for tavrinctl's shell; the real-time send's lock-free queue
  libedit-dev libreaderwriterqueue-dev
  # private D-Bus daemon for the orientation tests; PipeWire for the counters exporter
  dbus-daemon libpipewire-0.3-dev pipewire
  # systemd-analyze, which checks the packaged units; promtool, which checks the metrics file
  systemd prometheus
)

missing=()
for p in "${packages[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q '^install ok installed$'; then
    missing+=("$p")
  fi
done

if [ ${#missing[@]} -eq 0 ]; then
  echo "bootstrap: all ${#packages[@]} packages present"
  exit 0
fi

sudo=""
if [ "$(id -u)" -ne 0 ]; then sudo="sudo"; fi
echo "bootstrap: installing ${missing[*]}"
$sudo apt-get update -qq
DEBIAN_FRONTEND=noninteractive $sudo apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
echo "bootstrap: done"
