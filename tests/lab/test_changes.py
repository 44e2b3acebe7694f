"""What changes behind the box's back, and where a user is told of it."""
import json
import os
import signal
import stat
import time
import unittest

import homelab
from homelab import BOX, GATEWAY, LAN2, PUBLIC, wait_for

LAB = None


def published(daemon="upnpd"):
    """What the daemon knows; None when it says nothing."""
    try:
        return json.loads(LAB.read(f"/run/tavo/{daemon}.json"))
    except FileNotFoundError:
        return None


class Published(unittest.TestCase):
    """The state of the daemons, whole and true after each pass, and gone with them."""
    rules = ("1,1,tcp,5001,5001", "2,1,udp,6001,5002", "3,1,tcp,5001,5003", "4,1,tcp,7001-7003,1-2")

    def tearDown(self):
        LAB.stop_daemon(signal.SIGKILL)
        LAB.stop_router()
        LAB.clear_state()

    def test_it_says_what_became_of_each_rule_and_of_the_router(self):
        for daemon, protocol, router_word in (("upnpd", "UPnP", "ok"), ("natpmpd", "NAT-PMP", "ok")):
            with self.subTest(daemon=daemon):
                LAB.install(natpmp=daemon == "natpmpd")
                LAB.start_router()
                LAB.map_foreign(5001)
                LAB.save(*self.rules)
                state = wait_for(lambda: published(daemon), 5, "the state is there")
                self.assertEqual((state["protocol"], state["pid"], state["switched_on"], state["gateway"], state["box"],
                                  state["outside"], state["router"]),
                                 (protocol, LAB.daemon_pid(daemon), True, GATEWAY, BOX, PUBLIC, router_word))
                self.assertLess(abs(state["at"] - time.time()), 60)
                self.assertGreater(state["next_look"], state["at"])
                rows = {(row["name"], row["rule"]): row for row in state["rules"]}
                other = {"address": LAN2, "description": "libminiupnpc"} if daemon == "upnpd" else None
                taken = rows["5001/tcp", "service 1"]
                self.assertEqual((taken["state"], taken["holder"]), ("refused", other))
                game = rows["6001/udp", "service 2"]
                self.assertEqual((game["state"], game["word"], game["why"], game["protocol"], game["router_port"],
                                  game["box_port"]), ("open", "1", None, "udp", 6001, 5002))
                self.assertGreater(game["until"], state["at"])
                self.assertEqual(rows["5001/tcp (service 3)", "service 3"]["word"], "duplicate")
                self.assertEqual(rows["7001-7003/tcp", "service 4"]["router_port"], None)
                path = f"/run/tavo/{daemon}.json"
                self.assertEqual(stat.S_IMODE(os.stat(path).st_mode), 0o644)
                LAB.stop_daemon(signal.SIGTERM)
                self.assertIsNone(published(daemon))
                LAB.stop_router()


if __name__ == "__main__":
    homelab.run_tests(lambda lab: lab.serve(5001, 5002, 5003, 5004))
