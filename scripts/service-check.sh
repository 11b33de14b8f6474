#!/usr/bin/env bash
# Checks kestreld as the people who run it get it: the Debian package and the
# systemd service. As root, on Debian 12. Usage: scripts/service-check.sh
#
#  1. the package (scripts/package.sh), checked by lintian (no errors);
#  2. the unit: an exposure of at most 3.0 (systemd-analyze security);
#  3. a fresh Debian 12 root (mmdebstrap) booted with systemd as its PID 1 in
#     a container (systemd-nspawn), where:
#     - `apt install ./kestreld_*.deb` installs it, enables and starts the
#       unit, which systemd-analyze verify finds clean;
#     - kestrelctl (root's registered copy) creates a container through the
#       running service;
#     - the watchdog is answered, and a hung daemon is killed and restarted;
#     - the end-to-end tests pass against daemons that systemd runs with every
#       restriction of the unit (tools/confined-daemon.sh);
#     - removing and purging the package leaves the containers in place.
# Needs network access to the Debian archive (mmdebstrap, apt inside).
# KESTREL_DEB=<file> checks that package instead of building one.
set -euo pipefail
cd "$(dirname "$0")/.."
repo=$(pwd)
say() { printf '== %s\n' "$*"; }
fail() { printf 'service-check: FAILED: %s\n' "$*" >&2; exit 1; }

export DEBIAN_FRONTEND=noninteractive
tools=(lintian mmdebstrap systemd-container)
missing=()
for p in "${tools[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
if ((${#missing[@]})); then
  apt-get update -qq
  apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
fi

say "package"
# KESTREL_DEB=path checks a package built before instead.
deb=${KESTREL_DEB:-$(scripts/package.sh | tail -1)}
deb=$(realpath "$deb")
dpkg-deb --info "$deb" | sed -n '/Package:/,$p'
dpkg-deb --contents "$deb" | awk '{print $6}'
say "lintian"
lintian --fail-on error --info "$deb" || fail "lintian reports errors"

say "unit"
systemd-analyze security --offline=true dist/kestreld.service | tail -1
systemd-analyze security --offline=true --threshold=30 dist/kestreld.service >/dev/null ||
  fail "the unit's exposure is above 3.0"

say "a fresh Debian 12 with systemd"
work=$(mktemp -d /var/tmp/kestreld-service-check.XXXXXX)
container=
cleanup() {
  [[ -n $container ]] && kill "$container" 2>/dev/null && wait "$container" 2>/dev/null
  rm -rf "$work"
}
trap cleanup EXIT
mmdebstrap --quiet --variant=minbase --include=systemd,systemd-sysv,dbus,man-db,strace bookworm "$work/root"
cp "$deb" "$work/root/root/"
mkdir -p /run/systemd/nspawn/propagate  # nspawn wants it, whoever is PID 1
systemd-nspawn --quiet --boot --register=no --keep-unit -M kestreld-check -D "$work/root" \
  --bind-ro="$repo" --console=read-only >"$work/console.log" 2>&1 &
container=$!
init=
for _ in $(seq 100); do
  for child in $(pgrep -P "$container"); do
    for p in "$child" $(pgrep -P "$child"); do
      [[ $(cat /proc/$p/comm 2>/dev/null) == systemd ]] && init=$p
    done
  done
  [[ -n $init ]] && break
  sleep 0.2
done
[[ -n $init ]] || { cat "$work/console.log"; fail "the container did not boot"; }
inside() { nsenter --target "$init" --all -- env -C / "$@"; }
# Until its manager answers and has finished booting (its /tmp, its bus): on a
# busy machine that takes a while after PID 1 appears.
for _ in $(seq 240); do
  state=$(inside systemctl is-system-running 2>/dev/null || true)
  [[ $state == running || $state == degraded ]] && break
  sleep 0.5
done
[[ $state == running || $state == degraded ]] ||
  { cat "$work/console.log"; fail "the container did not finish booting ($state)"; }

say "apt install ./$(basename "$deb")"
inside apt-get update -qq
inside sh -c "cd /root && apt install -y -qq ./$(basename "$deb") 2>/dev/null >/dev/null"
inside systemctl is-enabled kestreld || fail "the unit is not enabled"
inside systemctl is-active kestreld || fail "the service is not running"
inside systemctl status --no-pager kestreld | head -12
verify=$(inside systemd-analyze verify /usr/lib/systemd/system/kestreld.service 2>&1)
[[ -z $verify ]] || { echo "$verify"; fail "systemd-analyze verify is not clean"; }

say "kestrelctl through the service"
# The accounts the daemon serves, and root's own copy of kestrelctl
# registered as an installer, as the README says.
inside groupadd -g 499 systemusers
inside useradd -u 499 -g 499 -d /private/var/empty -s /usr/sbin/nologin _systemcontainer
inside useradd -u 501 -U -m -d /private/var/mobile -s /bin/sh mobile
inside install -m 0700 /usr/bin/kestrelctl /usr/local/sbin/kestrelctl-admin
inside mkdir -p /etc/kestrel/signatures
inside tee /etc/kestrel/signatures/kestrelctl-admin.plist >/dev/null <<'PLIST'
<plist version="1.0"><dict>
  <key>SigningIdentifier</key><string>com.example.installer</string>
  <key>Executable</key><string>/usr/local/sbin/kestrelctl-admin</string>
  <key>Entitlements</key><dict>
    <key>com.zorvane.private.Kestrel.allowed</key><true/>
  </dict>
</dict></plist>
PLIST
made=$(inside kestrelctl-admin create --class Data/Application --user 501 --identifier com.example.app)
echo "$made"
container_path=$(awk '$1 == "path" {print $2}' <<<"$made")
[[ -n $container_path ]] && inside test -f "$container_path/.com.zorvane.kestrel.metadata.plist" ||
  fail "no container was made"

say "the watchdog: answered while the daemon runs, a hung one is restarted"
# A short interval for the check; SIGABRT waits for a stopped process, so a
# short abort time too.
inside mkdir -p /run/systemd/system/kestreld.service.d
inside tee /run/systemd/system/kestreld.service.d/watchdog.conf >/dev/null \
  <<<$'[Service]\nWatchdogSec=2s\nTimeoutAbortSec=2s'
inside systemctl daemon-reload
inside systemctl restart kestreld
sleep 5
[[ $(inside systemctl show -P NRestarts kestreld) == 0 ]] || fail "the watchdog fired at a running daemon"
inside systemctl kill --kill-whom=main --signal=SIGSTOP kestreld
for _ in $(seq 60); do
  [[ $(inside systemctl show -P NRestarts kestreld) -ge 1 ]] && break
  sleep 0.25
done
[[ $(inside systemctl show -P NRestarts kestreld) -ge 1 ]] || fail "the watchdog did not restart the daemon"
inside journalctl -u kestreld --no-pager | grep -E "watchdog|restart counter" | tail -2
inside rm -r /run/systemd/system/kestreld.service.d
inside systemctl daemon-reload
inside systemctl restart kestreld
inside systemctl is-active kestreld

say "end-to-end tests against daemons confined as the unit confines them"
# Each test in a process of its own, as ctest runs them.
tests=$repo/build/release/tests/kestrel_tests
passed=0
for t in $("$tests" --gtest_list_tests --gtest_filter='*EndToEnd*' |
  awk '/^[^ ]/ {group = $1} /^  / {print group $1}'); do
  inside env KESTREL_TEST_DAEMON_WRAPPER="$repo/tools/confined-daemon.sh" \
    "$tests" --gtest_brief=1 --gtest_filter="$t" || fail "$t under the unit's restrictions"
  passed=$((passed + 1))
done
echo "$passed end-to-end tests run under the unit's restrictions, none failed"

say "apt remove and purge leave the containers"
inside apt-get remove -y -qq kestreld >/dev/null
inside test -f "$container_path/.com.zorvane.kestrel.metadata.plist" || fail "removal took the container"
inside apt-get purge -y -qq kestreld >/dev/null
inside test -f "$container_path/.com.zorvane.kestrel.metadata.plist" || fail "purge took the container"
! inside systemctl is-enabled kestreld 2>/dev/null || fail "the unit is still enabled"
say "service check passed"
