#!/bin/bash
# Makes the Debian packages and takes them through their life without systemd: installed, used, built against,
# installed again over a running daemon, removed, purged; and installs from the build as it is. What systemd does
# with them is scripts/booted's. Runs inside tests/sandbox. Usage: package.sh BUILD_DIR
set -eu
cd "$(mktemp -d)"
export SYSTEMD_OFFLINE=1
rm -f /usr/sbin/policy-rc.d # which may forbid to start anything
fail() { echo "FAILED: $1" && exit 1; }
absent() { for szPath in "$@"; do [ ! -e "$szPath" ] || fail "$szPath is still there"; done; }
install() {
    local rgDebs=()
    for szPackage in "$@"; do rgDebs+=("$szPackage"_*.deb); done
    dpkg --force-depends -i "${rgDebs[@]}" >dpkg.log 2>&1 || { cat dpkg.log && fail "$* cannot be installed"; }
}
pid() { cat "/run/$1.pid" 2>/dev/null; }
alive() { [ -n "$(pid "$1")" ] && kill -0 "$(pid "$1")"; }
(umask 022 && cpack -G DEB --config "$1/CPackConfig.cmake" -B "$PWD" >cpack.log) || { cat cpack.log && exit 1; }
for szDeb in *.deb; do
    dpkg-deb -c "$szDeb" | grep '/changelog.gz$' >/dev/null || fail "$szDeb has no changelog"
    dpkg-deb -x "$szDeb" alone # a page of one package may not lead to another one's
    find alone/usr/share/doc -name '*.md' | while read -r szFile; do
        grep -oE '\]\([^):#]+' "$szFile" | sed 's/^](//' | while read -r szLink; do
            [ -e "$(dirname "$szFile")/$szLink" ] || fail "$szFile of $szDeb links to $szLink"
        done
    done
    rm -rf alone
done

# The port checker alone brings nothing else, and does not start by itself.
install ./libtavoportmap0 ./tavoportcheckd
[ "$(find /usr/tavo/sbin /usr/tavo/bin -mindepth 1 2>/dev/null | wc -l)" -le 2 ] || fail "the port checker brings more than itself"
[ ! -L /etc/systemd/system/multi-user.target.wants/tavoportcheckd.service ] || fail "the port checker is enabled"
[ "$(stat -c %a /etc/tavo/portcheck.conf)" = 600 ] || fail "others can read the port checker's token"
dpkg -P tavoportcheckd >/dev/null
absent /etc/tavo

install ./tavoportmap
for szUnit in $(dpkg -L tavoportmap | sed -n 's|^/usr/lib/systemd/system/||p'); do
    [ -L "/etc/systemd/system/multi-user.target.wants/$szUnit" ] || fail "$szUnit is not enabled"
    szProgram=$(sed -n 's/^ExecStart=\([^ ]*\).*/\1/p' "/usr/lib/systemd/system/$szUnit")
    [ -x "$szProgram" ] || fail "$szUnit starts $szProgram, which is not there"
done
for szProgram in /usr/tavo/sbin/* /usr/tavo/bin/tavo* $(dpkg -L tavoportmap | grep ^/usr/bin/.); do
    ! ldd "$szProgram" | grep -q 'not found' || fail "$szProgram lacks a library"
    dpkg -L tavoportmap | grep -q "/man[18]/${szProgram##*/}\.[18]\.gz$" || fail "$szProgram has no manual page"
done
readonly szPage=$(dpkg-deb --fsys-tarfile tavoportmap_*.deb | tar -xO ./usr/share/man/man5/platform.conf.5.gz | zcat)
for szKey in $(sed -n 's/^#\?\([a-z_]*\)=.*/\1/p' /etc/tavo/platform.conf); do
    grep -q "^.fB$szKey.fP=" <<<"$szPage" || fail "the page of the settings does not know $szKey"
done
for szTool in curl wget; do
    "/usr/tavo/bin/$szTool" --version >/dev/null || fail "the library's $szTool does not run"
done
[ -z "$(dpkg -L tavoportmap | grep ^/etc/ | while read -r szFile; do
    [ -d "$szFile" ] || dpkg-query -W -f '${Conffiles}' tavoportmap | grep -q " $szFile " || echo "$szFile"
done)" ] || fail "a file in /etc is no conffile"
[ "$(stat -c %a /tmp/upnp_test.lock)" = 600 ] || fail "the lock files are not there"
tavoportmap status | grep -q '^gateway' || fail "the installed tool does not run"
tavoportmap rules add web --router-port 443 >/dev/null
completed() { # WORDS... : what bash offers for the last one
    COMP_WORDS=(tavoportmap "$@") COMP_CWORD=$# && _tavoportmap && echo "${COMPREPLY[*]}"
}
source /usr/share/bash-completion/completions/tavoportmap
[ "$(completed rules --json a)" = add ] && [ -z "$(completed rules add --router-port 4)" ] &&
    [ "$(completed rules add --router)" = --router-port ] || fail "the completions do not know the commands"

# Programs are built against what is installed, by pkg-config and by CMake.
install ./libtavoportmap-dev
cp -r /usr/share/doc/libtavoportmap-dev/examples .
readonly szFlags=$(pkg-config --cflags --libs libtavoportmap)
cc -std=c11 -Wall -Werror examples/ports.c $szFlags -o ports && ./ports | grep -q '80-82, 443$' || fail "the C example"
c++ -std=c++20 -Wall -Werror examples/router.cpp $szFlags -o router && ./router | grep -q '^13 ports$' || fail "the C++ example"
cmake -S examples -B examples/b >cmake.log && cmake --build examples/b >>cmake.log || { cat cmake.log && fail "CMake"; }
examples/b/router >/dev/null || fail "what CMake builds does not run"

# A daemon that runs without systemd is replaced, with its parent, and ends before its program goes.
echo 'runupnpportmapping="yes"' >>/etc/tavoinfo.conf
/usr/tavo/sbin/upnpd
readonly nOld=$(pid upnpd)
install ./tavoportmap
alive upnpd && [ "$(pid upnpd)" != "$nOld" ] || fail "the old daemon was left running"
dpkg -r libtavoportmap-dev tavoportmap >/dev/null
absent /run/upnpd.pid /usr/bin/tavoportmap
! pgrep -x 'upnpd|tavowatch' >/dev/null || fail "a process was left running"
[ -e /etc/portforward/rule.conf.draft ] || fail "removing took the rules away"
install ./tavoportmap
alive upnpd || fail "what was switched on does not run again"

# A removal that is broken off: what it ended and took away comes back, also on a router's own pages (here is none).
script() { "/var/lib/dpkg/info/tavoportmap.$1" "$2" 2>&1; }
for szRules in there missing; do
    echo 'tcp' >/var/lib/tavo/pages_made.conf
    [ $szRules = missing ] || echo '# mine' >/etc/portforward/rule.conf
    script prerm remove | grep -q 'the router keeps forwards' && ! alive upnpd || fail "pages are not cleared, rules $szRules"
    [ $szRules = missing ] || grep -q mine /etc/portforward/rule.conf || fail "the rules went with the forwards"
    # Where another way is in use nothing is to come back to the pages.
    [ $szRules = missing ] && szWay= || szWay='support_router_upnp="yes"'
    printf '[192.0.2.1]\nconn_type="http"\n%s\n' "$szWay" >/etc/portforward/router.conf
    [ -z "$szWay" ] && szTold=1 || szTold=0
    [ "$(script postinst abort-remove | grep -c 'not all forwards are back')" = $szTold ] || fail "the pages are not filled again, or in vain"
    alive upnpd || fail "what a removal that was broken off had ended does not run again"
    rm -f /etc/portforward/rule.conf /etc/portforward/router.conf
done
kill -9 "$(pid upnpd)" # its parent is about to start it again
dpkg -P tavoportmap >/dev/null
! pgrep -x 'upnpd|tavowatch' >/dev/null || fail "a process was left running"
absent /etc/portforward /etc/tavo /etc/tavoinfo.conf /etc/logrotate.d/tavoportmap /var/lib/tavo /etc.defaults /run/upnpd*.lock /tmp/*.lock

# An installation from the build keeps what a user has changed.
cmake --install "$1" >install.log
grep -q 'systemctl enable --now' install.log || fail "nothing is said about what is to be enabled"
echo '# mine' >>/etc/tavo/platform.conf
cmake --install "$1" >install.log
tail -n 1 /etc/tavo/platform.conf | grep -q mine && grep -q 'Kept: /etc/tavo/platform.conf' install.log &&
    [ -s /etc/tavo/platform.conf.new ] || fail "a changed setting was overwritten"
