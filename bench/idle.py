"""What a daemon that has nothing to do costs: memory, processor, wake-ups and writes, while so many ports are open on
the real router daemon; and what a look at so many unchanged mappings costs beside a bare listing.

Usage: idle.py [SECONDS [PORTS...]]
"""
import os
import re
import statistics
import sys
import time

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), "..", "tests", "lab"))
import homelab

SECONDS = int(sys.argv[1]) if len(sys.argv) > 1 else 600
PORTS = [int(text) for text in sys.argv[2:]] or [100, 1000]
IGD = f"{homelab.BUILD}/bench/tavo-igd"
RUNS = 5


def field(pid, file, name):
    with open(f"/proc/{pid}/{file}", encoding="ascii") as text:
        return int(re.search(rf"^{name}:\s+(\d+)", text.read(), re.M)[1])


def cpu_seconds(pid):
    with open(f"/proc/{pid}/stat", encoding="ascii") as text:
        ticks = text.read().rpartition(")")[2].split()[11:13]
    return sum(map(int, ticks)) / os.sysconf("SC_CLK_TCK")


def idle(lab, daemon, ports):
    pid = lab.daemon_pid(daemon)
    before = cpu_seconds(pid), field(pid, "status", "voluntary_ctxt_switches"), field(pid, "io", "write_bytes")
    files = changes()
    time.sleep(SECONDS)
    spent = cpu_seconds(pid) - before[0]
    wakes = field(pid, "status", "voluntary_ctxt_switches") - before[1]
    written = field(pid, "io", "write_bytes") - before[2]
    changed = sorted(path for path, when in changes().items() if files.get(path) != when)
    print(f"{daemon} with {ports} ports, {SECONDS} s: {field(pid, 'status', 'VmRSS')} KiB resident, {spent:.2f} s of "
          f"processor, asleep {wakes} times, {written} bytes written to disk; files written: "
          f"{', '.join(changed) or 'none'}", flush=True)


def changes():
    """The files that a disk would hold, by when they were written."""
    return {entry.path: entry.stat().st_mtime_ns for folder in ("/var/lib/tavo", "/etc/portforward", "/var/tmp", "/etc")
            if os.path.isdir(folder) for entry in os.scandir(folder) if entry.is_file(follow_symlinks=False)}


def look(lab, ports):
    """A pass over what is as it is to be, beside the router's own listing."""
    lab.run("box", f"{IGD} map {ports}")
    def inside(command, word):
        out = lab.run("box", command).stdout
        return float(re.search(rf"^{word}_ms=([\d.]+)", out, re.M)[1])
    passes = statistics.median(inside(f"{IGD} map {ports}", "map") for _ in range(RUNS))
    listing = statistics.median(inside(f"{IGD} list", "list") for _ in range(RUNS))
    print(f"a look at {ports} unchanged mappings: {passes:.1f} ms, a bare listing {listing:.1f} ms, ratio "
          f"{passes / listing:.2f}", flush=True)
    lab.run("box", f"{IGD} unmap")


def main(lab):
    for daemon in homelab.DAEMONS:
        lab.install(natpmp=daemon == "natpmpd")
        lab.start_router()
        for ports in PORTS:
            rule = f"1,1,tcp,{20000}-{20000 + ports - 1},{20000}-{20000 + ports - 1}"
            assert lab.save(rule, seconds=300)["status"] == 0
            idle(lab, daemon, ports)
        lab.stop_daemon()
        if daemon == "upnpd":
            for ports in PORTS:
                look(lab, ports)
        lab.stop_router()
        lab.clear_state()
    return 0


if __name__ == "__main__":
    sys.exit(homelab.in_lab(main))
