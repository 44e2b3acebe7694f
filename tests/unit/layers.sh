#!/bin/bash
# Who may include whom. Fails also when a folder named here is gone, so that the rule cannot rot.
set -eu
cd "$1"
forbid() { # FOLDER PATTERN REASON
    [ -d "$1" ] || { echo "no folder $1"; exit 1; }
    if grep -rnE "#include [<\"]$2" "$1"; then
        echo "$1: $3"
        exit 1
    fi
}
readonly szPlatform='([^>"]*/)?(core|portforward|porttest|net|upnp|natpmp|task|log|daemons)/'
forbid src "$szPlatform" "the library knows the platform by its seam only"
forbid platform '([^>"]*/)?libtavoportmap' "the platform stands beneath the library"
forbid mapping '([^>"]*/)?(daemons|upnp|natpmp|net|porttest|portforward|task|log|tavo)/|(core/[^T])' \
    "the heart knows neither a protocol nor a program"
for szFolder in core log natpmp net portforward porttest task upnp; do
    forbid "platform/linux/$szFolder" '([^>"]*/)?(daemons/|mapping/[^R])' "the platform stands beneath the programs"
done
forbid cli "$szPlatform" "callers use the public header and the seam only"
forbid include '([^>"]*/)?tavo/' "the public header stands alone"
