"""tavo-igd (the classes of upnpd) beside Debian's upnpc, in one run against the same router."""
import http.client
import os
import statistics
import sys
import time

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), "..", "tests", "lab"))
import homelab
import networks

PORTS, FIRST, RUNS = 100, 20000, 5
IGD = f"{homelab.BUILD}/bench/tavo-igd"
DESCRIPTION = f"-u http://{homelab.GATEWAY}:5000/rootDesc.xml"  # spares upnpc its discovery
REDIRECTS = "-r " + " ".join(f"{FIRST + i} TCP" for i in range(PORTS))
AIRPORT_WAIT = 6.0  # six polls, one second apart
SERVICE = "urn:schemas-upnp-org:service:WANIPConnection:1"


def bare_adds():
    """What the router itself needs for the mappings: one request each, and nothing else."""
    start = time.monotonic()
    for port in range(FIRST, FIRST + PORTS):
        fields = {"RemoteHost": "", "ExternalPort": port, "Protocol": "TCP", "InternalPort": port,
                  "InternalClient": homelab.BOX, "Enabled": 1, "PortMappingDescription": "bare", "LeaseDuration": 0}
        body = ("<s:Envelope xmlns:s='http://schemas.xmlsoap.org/soap/envelope/'><s:Body>"
                f"<u:AddPortMapping xmlns:u='{SERVICE}'>"
                + "".join(f"<New{name}>{value}</New{name}>" for name, value in fields.items())
                + "</u:AddPortMapping></s:Body></s:Envelope>")
        connection = http.client.HTTPConnection(homelab.GATEWAY, 5000)
        connection.request("POST", "/ctl/IPConn", body, {"SOAPAction": f'"{SERVICE}#AddPortMapping"'})
        assert connection.getresponse().status == 200
        connection.close()
    print(f"map_ms={(time.monotonic() - start) * 1000}")


def timed(lab, command):
    start = time.monotonic()
    lab.run("box", command)
    return time.monotonic() - start


def median(lab, command, runs=RUNS):
    return statistics.median(timed(lab, command) for _ in range(runs))


def fresh(lab, *commands):
    """Each on an empty table, in turns; medians of the whole, and of the part that the command times itself."""
    times = [([], []) for _ in commands]
    for _ in range(RUNS):
        for command, (whole, inside) in zip(commands, times):
            assert not lab.mappings(), "mappings are left"
            start = time.monotonic()
            out = lab.run("box", command).stdout
            whole.append(time.monotonic() - start)
            assert len(lab.mappings()) == PORTS, "not all mappings were made"
            inside += [float(line[7:]) / 1000 for line in out.splitlines() if line.startswith("map_ms=")]
            lab.run("box", f"upnpc {DESCRIPTION} -N {FIRST} {FIRST + PORTS - 1} TCP")
    return [(statistics.median(whole), statistics.median(inside or whole)) for whole, inside in times]


def main(lab):
    lab.start_router()
    rows = [("discovery", median(lab, f"{IGD} discover"), median(lab, "upnpc -s", 3))]
    (ours, ours_inside), (theirs, _), (_, theirs_inside), (_, router) = fresh(
        lab, f"{IGD} map {PORTS}", f"upnpc {REDIRECTS}", f"upnpc {DESCRIPTION} {REDIRECTS}",
        f"/usr/bin/python3 {os.path.abspath(__file__)} bare")
    lab.run("box", f"{IGD} map {PORTS}")
    again, listing = median(lab, f"{IGD} map {PORTS}"), median(lab, f"{IGD} list")
    rows += [(f"{PORTS} fresh mappings", ours, theirs), ("  without discovery", ours_inside, theirs_inside),
             (f"the same {PORTS} again", again, timed(lab, f"upnpc {REDIRECTS}")),
             ("a listing", listing, median(lab, "upnpc -l", 3))]
    print(f"{'':24} {'tavo-igd':>10} {'upnpc':>10} {'ratio':>8}")
    for name, mine, other in rows:
        print(f"{name:24} {mine:>8.3f} s {other:>8.3f} s {other / mine:>7.1f}x")
    print(f"{'bare adds, one by one':24} {router:>8.3f} s   nothing but AddPortMapping: the router's own time")
    print(f"{'again / listing':24} {again / listing:>10.2f}")
    networks.Outside(lab)
    detection = median(lab, f"{homelab.BUILD}/tests/lab/detector", 3)
    print(f"{'a whole detection':24} {detection:>8.3f} s {AIRPORT_WAIT:>8.3f} s   of it the wait for base stations")
    return 0


if __name__ == "__main__":
    sys.exit(bare_adds() if sys.argv[1:] == ["bare"] else homelab.in_lab(main))
