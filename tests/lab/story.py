"""The main job, shown: three saves against a real router, and a stranger who tries each port."""
import sys

import homelab
from homelab import BOX, LAN2

SAVES = (
    ("first rules", ("1,1,tcp,5001,5001", "2,1,udp,6001,5002", "3,1,all,7001,5003")),
    ("changed rules", ("1,1,tcp,5001,5002", "2,0,udp,6001,5002")),
    ("no rules", ()),
)
PROBES = (("tcp", 5001), ("udp", 6001), ("tcp", 7001), ("udp", 7001))
ROW = "  {:<10} {:<34} {:<24} {:<8} {}"


def show(lab, rules):
    wanted = {}
    for rule in rules:
        _, enabled, protocol, router_port, box_port = rule.split(",")
        for single in ("tcp", "udp") if protocol == "all" else (protocol,):
            if enabled == "1":
                wanted[(single, int(router_port))] = (BOX, int(box_port))
    wrong = 0
    mappings = lab.mappings()
    for probe in PROBES:
        name = f"{probe[1]}/{probe[0]}"
        asked = "box port %d" % wanted[probe][1] if probe in wanted else "nothing"
        there = "%s:%d" % mappings[probe] if probe in mappings else "no mapping"
        outcome = "open" if lab.reaches(*probe) else "closed"
        right = mappings.get(probe) == wanted.get(probe) and (outcome == "open") == (probe in wanted)
        wrong += not right
        print(ROW.format(name, asked, there, outcome, "as asked" if right else "WRONG"))
    foreign = mappings.get(("tcp", 9999))
    print(ROW.format("9999/tcp", "another host's", "%s:%d" % foreign if foreign else "gone", "",
                     "untouched" if foreign == (LAN2, 9999) else "WRONG"))
    return wrong + (foreign != (LAN2, 9999))


def main(lab):
    lab.serve(5001, 5002, 5003)
    lab.start_router()
    lab.map_foreign(9999)
    wrong = 0
    for title, rules in SAVES:
        answer = lab.save(*rules)
        print(f"\nSaved: {title} (result {answer['result']}, progress {answer['progress']})")
        print(ROW.format("port", "rule asks for", "the router's mapping", "outside", ""))
        if not rules:  # nothing to read back, so the save does not wait for the router
            homelab.wait_for(lambda: set(lab.mappings()) == {("tcp", 9999)}, 10, "the mappings are gone")
        wrong += (answer["result"] != 0) + show(lab, rules)
    print("\n" + ("All as asked." if not wrong else f"{wrong} differ."))
    return 1 if wrong else 0


if __name__ == "__main__":
    sys.exit(homelab.in_lab(main))
