#!/bin/sh
# The packaged unit files are valid and the service's sandbox scores "OK" or better (exposure
# under 4.0) in systemd's own security review, read offline from the unit file.
set -eu
units=$1/packaging/systemd
systemd-analyze verify --man=no --recursive-errors=no "$units/tavrind.socket" 2>&1 \
  | grep -v 'is not executable\|Unit tavrind.service not found' | grep . && exit 1
status=0
review=$(systemd-analyze security --offline=true --threshold=39 "$units/tavrind.service") || status=$?
printf '%s\n' "$review" | tail -n 1
exit "$status"
