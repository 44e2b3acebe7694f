"""tavo-igd (the classes of upnpd) beside Debian's upnpc, in one run against the same router."""
import os
import statistics
import sys
import time

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), "..", "tests", "lab"))
import homelab

PORTS = 100
IGD = f"{homelab.BUILD}/platform/linux/daemons/tavo-igd"


def timed(lab, *commands):
    start = time.monotonic()
    for command in commands:
        lab.run("box", command)
    return time.monotonic() - start


def median(lab, runs, *commands):
    return statistics.median(timed(lab, *commands) for _ in range(runs))


def main(lab):
    lab.start_router()
    redirects = "upnpc -r " + " ".join(f"{20000 + i} TCP" for i in range(PORTS))
    rows = [("discovery", median(lab, 5, f"{IGD} discover"), median(lab, 3, "upnpc -s"))]
    ours = timed(lab, f"{IGD} map {PORTS}")
    again = median(lab, 3, f"{IGD} map {PORTS}")
    listing = median(lab, 3, f"{IGD} list")
    assert len(lab.mappings()) == PORTS, "not all mappings were made"
    lab.run("box", f"{IGD} unmap")
    assert not lab.mappings(), "mappings are left"
    theirs = timed(lab, redirects)
    assert len(lab.mappings()) == PORTS, "not all mappings were made"
    rows += [(f"{PORTS} fresh mappings", ours, theirs), (f"the same {PORTS} again", again, timed(lab, redirects)),
             ("a listing", listing, median(lab, 3, "upnpc -l"))]
    print(f"{'':24} {'tavo-igd':>10} {'upnpc':>10} {'ratio':>8}")
    for name, mine, other in rows:
        print(f"{name:24} {mine:>8.3f} s {other:>8.3f} s {other / mine:>7.1f}x")
    print(f"{'again / listing':24} {again / listing:>10.2f}")
    return 0


if __name__ == "__main__":
    sys.exit(homelab.in_lab(main))
