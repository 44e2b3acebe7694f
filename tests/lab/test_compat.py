"""The UPnP compatibility test: what it says of routers that lie, and that it leaves none of its mappings."""
import json
import os
import signal
import subprocess
import unittest

import homelab
import test_reach
from homelab import BOX, BUILD, LAN2, TOOL, wait_for

LAB = None
USER_DB = "/etc/portforward/router_upnp.db.user"
FILES = ("/tmp/upnp_test.progress", "/var/tmp/upnp_portmap.status", "/var/log/router.log", "/tmp/pfStatusRule")
RULES = "/var/lib/tavo/upnp_test.conf"


def start(*arguments):
    return LAB.start("box", f"{BUILD}/tests/lab/compat", *map(str, arguments), stdout=subprocess.PIPE, text=True)


def run(rules, how="steps", seconds=60):
    out, _ = start(how, rules).communicate(timeout=seconds)
    return json.loads(out)


def test_daemon():
    return LAB.processes_of("/usr/tavo/sbin/upnpd --debug -p")


class Compat(unittest.TestCase):
    def setUp(self):
        LAB.install()
        LAB.clear_state(*FILES, USER_DB)

    def tearDown(self):
        LAB.stop_daemon(signal.SIGKILL)
        for pid in test_daemon():
            os.kill(pid, signal.SIGKILL)
        LAB.stop_router()

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

    # fault, mappings asked for, the step that fails, the count, mappings that the router keeps afterwards
    table = (
        ("none", 5, "", 5, 0),
        ("only_permanent", 5, "", 5, 0),
        ("full_at_32", 60, "", 32, 0),
        ("says_full_at_32", 60, "", 32, 0),
        ("keeps_nothing", 5, "upnp_add", 0, 0),
        ("action_failed_501", 5, "upnp_add", 0, 0),
        ("silent_at_10", 60, "upnp_add", 0, 10),
        ("deletes_nothing", 5, "upnp_delete", 5, 5),
        ("refuses_again", 5, "upnp_readd1", 5, 0),
    )

    def test_routers_that_lie(self):
        for fault, rules, failed, count, left in self.table:
            with self.subTest(fault=fault):
                LAB.start_scripted(fault)
                answer = run(rules)
                self.assertEqual((answer["failed"], answer["count"]), (failed, count))
                self.ended()
                self.assertEqual(len(LAB.scripted()["table"]), left)
                self.assertEqual([path for path in FILES if not os.path.exists(path)], [])
                LAB.end(LAB.router)

    def test_what_the_rules_have_is_a_part_of_the_limit(self):
        LAB.start_scripted("full_at_32")
        LAB.save("1,1,tcp,24501,5001", "2,1,tcp,6001,5002")
        answer = run(60)
        self.assertEqual((answer["failed"], answer["count"]), ("", 32))
        self.assertEqual(sorted(row[1] for row in LAB.scripted()["table"]), [6001, 24501])

    def test_the_library_in_its_own_time(self):
        LAB.start_router()
        self.assertEqual(run(10, "test"), {"result": 0, "status": 0, "support": "yes", "max": 10})
        self.assertEqual(LAB.mappings(), {})
        LAB.stop_router()
        LAB.start_scripted("keeps_nothing")
        self.assertEqual(run(10, "test"), {"result": 1, "status": 0, "support": "no", "max": -1})

    def test_the_tool_that_is_interrupted_leaves_nothing(self):
        LAB.start_scripted("silent_adds_at_10")
        tool = LAB.start("box", TOOL, "compat", "--yes", stderr=subprocess.PIPE, text=True)
        wait_for(lambda: len(LAB.scripted()["table"]) == 10, 20, "some mappings are there")
        refused = LAB.run("box", f"{TOOL} compat", check=False)
        self.assertIn("running already", refused.stderr)
        self.assertEqual(len(LAB.scripted()["table"]), 10)
        tool.send_signal(signal.SIGINT)
        self.assertIn("the test is stopped", tool.communicate(timeout=5)[1])
        self.ended(0)
        self.assertEqual(LAB.scripted()["table"], [])
        self.assertFalse(os.path.exists(USER_DB))

    def test_a_second_start_ends_the_first(self):
        LAB.start_scripted("silent_adds_at_10")
        first = start("test", 60)
        wait_for(lambda: len(LAB.scripted()["table"]) == 10, 10, "some mappings are there")
        self.assertEqual(run(10, "test")["result"], -1)  # the lock is the first one's
        self.ended(15)
        self.assertEqual(json.loads(first.communicate(timeout=20)[0])["result"], 1)
        self.assertEqual(LAB.scripted()["table"], [])

    def test_a_checker_outside_is_believed(self):
        LAB.start_router()
        test_reach.configure()
        checker = test_reach.start_checker()
        try:
            self.assertEqual(run(10)["failed"], "")
            self.assertIn("from outside 4 of 4 test ports are open", LAB.read("/var/log/router.log"))
            test_reach.drop("router", "tcp", "24500-24600", "forward")  # a router that says yes and passes nothing on
            self.assertEqual(run(10)["failed"], "upnp_connection_success")
            LAB.end(checker)
            self.ended()
            self.assertEqual(run(10)["failed"], "")
            self.assertIn("the router's own table is the judge", LAB.read("/var/log/router.log"))
            self.ended()
            self.assertEqual(LAB.mappings(), {})
        finally:
            LAB.end(checker)
            LAB.run("router", "nft delete table inet blocked", check=False)

    def test_stop_ends_a_test_that_hangs(self):
        for fault, left in (("silent_adds_at_10", 0), ("silent_at_10", 10)):
            with self.subTest(fault=fault):
                LAB.start_scripted(fault)
                caller = start("steps", 60)
                wait_for(lambda: len(LAB.scripted()["table"]) == 10, 10, "the router has become silent")
                self.assertEqual(start("stop").wait(5), 0)
                self.ended(3)
                self.assertEqual(len(LAB.scripted()["table"]), left)
                self.assertEqual(caller.wait(5), 1)
                self.assertEqual([path for path in FILES if os.path.exists(path)], [])
                LAB.end(LAB.router)

    def test_terminated_and_killed(self):
        """Of the daemon's two processes either takes care of the end of the other."""
        LAB.start_scripted("silent_adds_at_10")
        for how, which, left in ((signal.SIGTERM, (0,), 0), (signal.SIGTERM, (1,), 0), (signal.SIGKILL, (0,), 0),
                                 (signal.SIGKILL, (1,), 0), (signal.SIGKILL, (0, 1), 10)):
            with self.subTest(how=how, which=which):
                caller = start("steps", 60)
                wait_for(lambda: len(LAB.scripted()["table"]) == 10, 10, "some mappings are there")
                pids = sorted(test_daemon())
                for index in which:
                    os.kill(pids[index], how)
                self.ended()
                self.assertEqual(len(LAB.scripted()["table"]), left)
                if not left:
                    self.assertEqual(json.loads(caller.communicate(timeout=5)[0])["failed"], "upnp_add")
                LAB.end(caller)
        self.assertEqual(run(3)["failed"], "")  # the next one cleans up
        self.assertEqual(LAB.scripted()["table"], [])


if __name__ == "__main__":
    homelab.run_tests(lambda lab: lab.serve(5001, 5002))
