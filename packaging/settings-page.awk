# Makes platform.conf(5) of platform.conf, in which each setting is described, so that there is one text of them.
# Relies on the form of that file: remarks, and below them the keys that they are about, with their defaults.
BEGIN {
    print ".TH PLATFORM.CONF 5 \"\" \"libtavoportmap\" \"File formats\""
    print ".SH NAME"
    print "platform.conf \\- settings of the programs that get ports through a home router"
    print ".SH SYNOPSIS"
    print ".I /etc/tavo/platform.conf"
    print ".SH DESCRIPTION"
}

function roff(szText) {
    gsub(/\\/, "\\e", szText)
    gsub(/-/, "\\-", szText)
    gsub(/'/, "\\(aq", szText)
    return szText ~ /^\./ ? "\\&" szText : szText
}

# The keys that have been read, and what was said above them.
function flush_keys(    i) {
    for (i = 1; i <= nKeys; ++i) {
        print (i == 1 ? ".TP" : ".TQ")
        print "\\fB" roff(rgszKeys[i]) "\\fP=" roff(rgszDefaults[i])
    }
    printf "%s", szSaid
    nKeys = 0
    szSaid = ""
}

/^\[/ {
    flush_keys()
    print ".SS " $0
}

/^# / {
    if (nKeys > 0) {
        flush_keys()
    }
    szSaid = szSaid roff(substr($0, 3)) "\n"
}

/^#[^ ]/ {
    nEquals = index($0, "=")
    rgszKeys[++nKeys] = substr($0, 2, nEquals - 2)
    rgszDefaults[nKeys] = substr($0, nEquals + 1)
}

END {
    flush_keys()
    print ".SH EXAMPLE"
    print ".nf"
    print "[upnpd]"
    print "check_interval=\"60\""
    print ".fi"
    print ".SH SEE ALSO"
    print ".BR tavoportmap (1),"
    print ".BR tavo\\-netcheck (1),"
    print ".BR upnpd (8)"
}
