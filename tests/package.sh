#!/bin/bash
# Makes the Debian package and takes it through its life: installed, used, installed again over a running
# daemon, removed, purged. Runs inside tests/sandbox. Usage: package.sh BUILD_DIR
set -eu
cd "$(mktemp -d)"
export SYSTEMD_OFFLINE=1
fail() { echo "FAILED: $1" && exit 1; }
absent() { [ ! -e "$1" ] || fail "$1 is still there"; }
cpack -G DEB --config "$1/CPackConfig.cmake" -B "$PWD" >cpack.log || { cat cpack.log && exit 1; }
readonly szPackage=$(echo "$PWD"/*.deb)

dpkg --force-depends -i "$szPackage" >/dev/null
for szUnit in $(dpkg -L libtavoportmap | sed -n 's|^/usr/lib/systemd/system/||p'); do
    blEnabled=$([ -L "/etc/systemd/system/multi-user.target.wants/$szUnit" ] && echo yes || echo no)
    [ "$blEnabled" = "$([ "$szUnit" = tavoportcheckd.service ] && echo no || echo yes)" ] ||
        fail "$szUnit enabled: $blEnabled"
    szProgram=$(sed -n 's/^ExecStart=\([^ ]*\).*/\1/p' "/usr/lib/systemd/system/$szUnit")
    [ -x "$szProgram" ] || fail "$szUnit starts $szProgram, which is not there"
    ldd "$szProgram" | grep -q 'not found' && fail "$szProgram lacks a library"
done
for szTool in curl wget; do
    "/usr/tavo/bin/$szTool" --version >/dev/null || fail "the library's $szTool does not run"
done
for szConf in platform.conf portcheck.conf; do
    dpkg-query -W -f '${Conffiles}' libtavoportmap | grep -q "^ */etc/tavo/$szConf " || fail "$szConf is no conffile"
done
[ "$(stat -c %a /etc/tavo/portcheck.conf)" = 600 ] || fail "others can read the port checker's token"
[ "$(stat -c %a /tmp/upnp_test.lock)" = 600 ] || fail "the lock files are not there"
tavoportmap status | grep -q '^gateway' || fail "the installed tool does not run"
tavoportmap rules add web --router-port 443 >/dev/null

/usr/tavo/sbin/upnpd
readonly nOld=$(cat /run/upnpd.pid)
dpkg --force-depends -i "$szPackage" >/dev/null
[ "$(cat /run/upnpd.pid)" != "$nOld" ] || fail "the old daemon was left running"

dpkg -r libtavoportmap >/dev/null
absent /run/upnpd.pid
absent /usr/bin/tavoportmap
[ -e /etc/portforward/rule.conf ] || fail "removing took the rules away"
dpkg -P libtavoportmap >/dev/null
absent /etc/portforward
absent /etc/tavo
