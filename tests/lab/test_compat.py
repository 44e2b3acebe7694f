"""The UPnP compatibility test: what it says of routers that lie, and that it leaves none of its mappings."""
import json
import os
import signal
import subprocess
import unittest

import homelab
from homelab import BOX, BUILD, GATEWAY, LAN2, WAN, wait_for

LAB = None
FILES = ("/tmp/upnp_test.progress", "/var/tmp/upnp_portmap.status", "/var/log/router.log", "/tmp/pfStatusRule")
RULES = "/var/lib/tavo/upnp_test.conf"


def start(rules):
    return LAB.start("box", f"{BUILD}/tests/lab/compat", str(rules), stdout=subprocess.PIPE, text=True)


def run(rules, seconds=60):
    out, _ = start(rules).communicate(timeout=seconds)
    return json.loads(out)


def test_daemon():
    return LAB.processes_of("/usr/tavo/sbin/upnpd --debug -p")


class Compat(unittest.TestCase):
    def setUp(self):
        LAB.install()
        for path in FILES:
            if os.path.exists(path):
                os.unlink(path)

    def tearDown(self):
        LAB.stop_daemon(signal.SIGKILL)
        for pid in test_daemon():
            os.kill(pid, signal.SIGKILL)
        if LAB.router is not None:
            LAB.stop_router()
        LAB.router = None

    def ended(self, seconds=3):
        wait_for(lambda: not test_daemon(), seconds, "the test daemon has ended")

    def test_real_router(self):
        LAB.start_router()
        LAB.map_foreign(24502)
        LAB.save("1,1,tcp,24501,5001", "2,1,tcp,24503,5002")
        pid, before = LAB.daemon_pid(), LAB.mappings()
        for rules in (10, 60):
            answer = run(rules)
            self.assertEqual((answer["failed"], answer["count"]), ("", rules))
            self.ended()
            self.assertEqual(LAB.mappings(), before)
            self.assertEqual(LAB.daemon_pid(), pid)
            self.assertEqual([path for path in FILES if not os.path.exists(path)], [])
            self.assertFalse(os.path.exists(RULES))
        self.assertEqual(before, {("tcp", 24501): (BOX, 5001), ("tcp", 24502): (LAN2, 24502),
                                  ("tcp", 24503): (BOX, 5002)})
        print(answer)


def prepare(lab):
    global LAB
    LAB = lab
    lab.serve(5001, 5002)


if __name__ == "__main__":
    homelab.run_tests(prepare)
