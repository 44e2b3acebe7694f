"""How long a port that was open stays closed after something has changed, on the real router daemon.

Median, 99th percentile and worst of so many times for each cause; the time begins when the router could serve again.
Usage: recovery.py [TIMES [WORDS OF A CAUSE]]
"""
import math
import os
import signal
import statistics
import sys
import time

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), "..", "tests", "lab"))
import homelab
from homelab import BOX, GATEWAY, sh, wait_for

TIMES = int(sys.argv[1]) if len(sys.argv) > 1 else 20
ONLY = " ".join(sys.argv[2:])
NEW = "192.168.77.5"
PEACE = 6
LIMIT = 130  # the regular look comes within two minutes


def seconds_until_open(lab):
    start = time.monotonic()
    wait_for(lambda: lab.mappings() == {("tcp", 5001): (lab.box, 5001)}, LIMIT, "open again")
    return time.monotonic() - start


def in_peace(cause):
    """Not at once after the last one: what others can cause has a pass in five seconds, and a router's boot number
    counts seconds."""
    def timed(lab):
        time.sleep(PEACE)
        return cause(lab)
    return timed


@in_peace
def restart(lab):
    lab.stop_router()
    lab.start_router(secure=False)
    return seconds_until_open(lab)


def move(lab):
    old, lab.box = lab.box, NEW if lab.box == BOX else BOX
    sh(f"ip -n box addr add {lab.box}/24 dev box0 && ip -n box addr del {old}/24 dev box0 && "
       f"ip -n box route replace default via {GATEWAY}")


@in_peace
def own_address(lab):
    move(lab)
    return seconds_until_open(lab)


@in_peace
def gateway_gone(lab):
    """No way out while the router restarts, and then the way is back."""
    sh("ip -n box route del default")
    lab.stop_router()
    lab.start_router(secure=False)
    wait_for(lambda: '"no_gateway"' in lab.read(f"/run/tavo/{lab.daemon}.json"), LIMIT, "the daemon has seen it")
    sh(f"ip -n box route add default via {GATEWAY}")
    return seconds_until_open(lab)


CAUSES = (("upnpd", "router restarts, announced", restart, TIMES), ("upnpd", "own address changes", own_address, TIMES),
          ("upnpd", "gateway away and back", gateway_gone, TIMES),
          ("natpmpd", "router restarts, announced", restart, TIMES))


def main(lab):
    lab.box = BOX
    print(f"{'':36} {'times':>5} {'median':>9} {'99 %':>9} {'worst':>9}")
    for daemon, name, cause, times in CAUSES:
        if ONLY not in f"{daemon}: {name}":
            continue
        lab.install(natpmp=daemon == "natpmpd")
        lab.start_router(secure=False)
        lab.daemon = daemon
        assert lab.save("1,1,tcp,5001,5001")["status"] == 0
        times = sorted(cause(lab) for _ in range(times))
        nearest = times[math.ceil(0.99 * len(times)) - 1]
        print(f"{daemon + ': ' + name:36} {len(times):>5} {statistics.median(times):>7.2f} s {nearest:>7.2f} s "
              f"{times[-1]:>7.2f} s", flush=True)
        lab.stop_daemon(signal.SIGKILL)
        lab.stop_router()
        lab.clear_state()
        if lab.box != BOX:
            move(lab)
    print("Waiting rules of others: a client that renews at half its lease of an hour, and does not listen, needs up to\n"
          "30 minutes; one that asks once at its start, for ever.")


if __name__ == "__main__":
    homelab.in_lab(main)
