#!/usr/bin/env bash
# Runs kestreld confined exactly as dist/kestreld.service confines it, through
# the running systemd (systemd-run), on the root given by KESTREL_ROOT:
#
#   KESTREL_ROOT=/tmp/root tools/confined-daemon.sh build/release/kestreld
#
# Every setting of the unit's [Service] section is applied, except those that
# only make sense for the installed service: ExecStart (the binary given),
# Environment (KESTREL_ROOT is passed on), Restart* (a test wants the exit
# status) and RuntimeDirectory* (the root has its own run/kestrel).
# ReadWritePaths are taken beneath the root. SIGTERM or SIGINT stop the unit;
# the exit status is the daemon's. The end-to-end tests use it as their
# KESTREL_TEST_DAEMON_WRAPPER (scripts/service-check.sh runs them so inside a
# container booted with systemd).
set -euo pipefail
here=$(cd "$(dirname "$0")/.." && pwd)
unit_file=${KESTREL_UNIT_FILE:-$here/dist/kestreld.service}
daemon=$(realpath "$1")
root=${KESTREL_ROOT:?KESTREL_ROOT names the daemon root}
[[ -d /run/systemd/system ]] || { echo "confined-daemon: systemd is not running" >&2; exit 1; }

properties=()
section=
while IFS= read -r line; do
  [[ $line =~ ^\[(.*)\]$ ]] && { section=${BASH_REMATCH[1]}; continue; }
  [[ $section == Service && $line =~ ^([A-Za-z]+)=(.*)$ ]] || continue
  key=${BASH_REMATCH[1]} value=${BASH_REMATCH[2]}
  case $key in
    ExecStart | Environment | Restart* | RuntimeDirectory*) ;;
    ReadWritePaths)
      paths=()
      for p in $value; do paths+=("$root$p"); mkdir -p "$root$p"; done
      properties+=("--property=ReadWritePaths=${paths[*]}") ;;
    *) properties+=("--property=$key=$value") ;;
  esac
done <"$unit_file"

unit=kestreld-confined-$$
interrupted=0
stop() {
  interrupted=1
  systemctl stop "$unit" 2>/dev/null || true
}
trap stop TERM INT
systemd-run --quiet --collect --wait --pipe --unit="$unit" \
  --setenv=KESTREL_ROOT="$root" "${properties[@]}" "$daemon" &
runner=$!
status=0
wait "$runner" || status=$?
# A trapped signal ends the first wait early; the second one returns the real status.
if ((interrupted)); then
  status=0
  wait "$runner" || status=$?
fi
exit "$status"
