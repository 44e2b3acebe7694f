"""How long a port that was open stays closed after something has changed, on the real router daemon.

Median, 99th percentile and worst of so many times for each cause; the time begins when the router could serve again.
Usage: recovery.py [TIMES [WORDS OF A CAUSE]]
"""
import functools
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
LONG_PEACE = 45  # the next look is up to 40 s off by then
LIMIT = 130  # the regular look comes within two minutes
FEW = min(TIMES, 3)  # of what only a look finds: each takes its interval
DEAF = f"""
table inet deaf {{
  chain input {{
    type filter hook input priority 0
    udp dport {{ 1900, 5350 }} drop
    ip saddr {GATEWAY} tcp flags & (syn | ack) == syn drop
  }}
}}
"""


def seconds_until_open(lab):
    start = time.monotonic()
    wait_for(lambda: lab.mappings() == {("tcp", 5001): (lab.box, 5001)}, LIMIT, "open again")
    return time.monotonic() - start


def in_peace(cause, seconds=PEACE):
    """Not at once after the last one: what others can cause has a pass in five seconds, and a router's boot number
    counts seconds."""
    @functools.wraps(cause)
    def timed(lab):
        time.sleep(seconds)
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


@in_peace
def cable(lab):
    """The router restarts while the cable is out, and nobody hears it."""
    sh("ip -n router link set box1 down")
    lab.reboot_router(wait=False, secure=False)
    time.sleep(2)
    sh("ip -n router link set box1 up")
    return seconds_until_open(lab)


@in_peace
def killed(lab):
    """The daemon, at the moment at which the router restarts; its parent starts it again."""
    os.kill(lab.daemon_pid(lab.daemon), signal.SIGKILL)
    return restart.__wrapped__(lab)


def taken(lab):
    """Somebody has taken the mapping away at the router."""
    lab.run("lan2", "upnpc -d 5001 TCP")
    assert not lab.mappings()
    return seconds_until_open(lab)


def deaf(cause):
    """What the router tells of its own accord does not arrive."""
    def timed(lab):
        lab.run("box", "nft -f -", input=DEAF)
        try:
            return cause(lab)
        finally:
            lab.run("box", "nft delete table inet deaf")
    return in_peace(timed, LONG_PEACE)


CAUSES = (("upnpd", "router restarts, announced", restart, TIMES), ("upnpd", "own address changes", own_address, TIMES),
          ("upnpd", "gateway away and back", gateway_gone, TIMES),
          ("upnpd", "restarts while the cable is out", cable, TIMES),
          ("upnpd", "restarts, the daemon is killed", killed, min(TIMES, 8)),  # its parent gives up after ten
          ("upnpd", "taken away, router tells it", in_peace(taken), TIMES),
          ("upnpd", "restarts, not heard", deaf(restart.__wrapped__), FEW),
          ("upnpd", "taken away silently", deaf(taken), FEW),
          ("natpmpd", "router restarts, announced", restart, TIMES),
          ("natpmpd", "restarts, not heard", deaf(restart.__wrapped__), FEW))


def main(lab):
    lab.box = BOX
    print(f"{'':41} {'times':>5} {'median':>9} {'99 %':>9} {'worst':>9}")
    for daemon, name, cause, times in CAUSES:
        if ONLY not in f"{daemon}: {name}":
            continue
        lab.install(natpmp=daemon == "natpmpd")
        lab.start_router(secure=False)
        lab.daemon = daemon
        assert lab.save("1,1,tcp,5001,5001")["status"] == 0
        times = sorted(cause(lab) for _ in range(times))
        nearest = times[math.ceil(0.99 * len(times)) - 1]
        print(f"{daemon + ': ' + name:41} {len(times):>5} {statistics.median(times):>7.2f} s {nearest:>7.2f} s "
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
