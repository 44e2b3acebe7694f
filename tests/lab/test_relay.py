"""A service's ports between the user's rules and another host's mappings, from the request to the stranger."""
import json
import os
import signal
import unittest

import homelab
import test_reach
from homelab import BOX, LAN2, TOOL, wait_for

LAB = None
RULES = "/etc/portforward/rule.conf"
LOST = 5003  # lan2's
USERS = {("tcp", 8080): (BOX, 5001), ("tcp", 5005): (BOX, 5005)}
RELOADS = "/tmp/relay.reloads"
# The relay service: reads its settings again on a signal, which is all that it does here.
DAEMON = f"""
import os, signal


def reload(*_):
    with open('{RELOADS}', 'a') as file:
        file.write('reload\\n')
signal.signal(signal.SIGHUP, reload)
with open('/run/tavorelayd.pid', 'w') as file:
    file.write(str(os.getpid()))
print(flush=True)
while True:
    signal.pause()
"""
INIT = """#!/bin/sh
pid=$(cat /run/tavorelayd.pid) || exit 3
case $1 in
    status) kill -0 $pid ;;
    reload) kill -HUP $pid ;;
    *) exit 2 ;;
esac
"""


def rule(number, enabled, protocol, router, box, service="", service_id=""):
    return (f'[{number}]\nenabled="{enabled}"\ns_port="{box}"\nr_port="{router}"\nprotocol name="{protocol}"\n'
            f'service_id="{service_id}"\nservice="{service}"\n\n')


class Relay(unittest.TestCase):
    def setUp(self):
        LAB.install()
        LAB.clear_state(RELOADS)
        LAB.start_router()
        LAB.map_foreign(LOST)
        self.relay = test_reach.program("box", DAEMON)
        self.users = (("1", "tcp", "8080", "5001", "web", ""), ("1", "tcp", "5005", "5005", "", ""),
                      ("0", "udp", "6000", "6000", "off", ""))
        LAB.write(RULES, "".join(rule(number, *fields) for number, fields in enumerate(self.users, 7)))

    def tearDown(self):
        LAB.stop_daemon(signal.SIGKILL)
        LAB.end(self.relay)
        self.relay.stdout.close()
        LAB.stop_router()

    def kept(self, *rules):
        self.assertEqual(LAB.read(RULES), "".join(rule(number, *fields) for number, fields in enumerate(rules, 1)))

    @staticmethod
    def set(*requests, test=False):
        words = ("set hoplink", *requests, "--force", *(("--test",) if test else ())) if requests else ("clear hoplink",)
        return json.loads(LAB.run("box", f"{TOOL} --json service {' '.join(words)}", check=False).stdout)

    def mapped(self, *own):
        self.assertEqual(LAB.mappings(), {("tcp", LOST): (LAN2, LOST), **USERS,
                                          **{(protocol, port): (BOX, port) for protocol, port in own}})

    def reloaded(self, times):
        wait_for(lambda: (os.path.exists(RELOADS) and LAB.read(RELOADS).count("reload")) or not times, 5, "a reload")
        self.assertEqual(LAB.read(RELOADS).count("reload") if times else os.path.exists(RELOADS), times)

    def test_asks_tests_and_clears(self):
        checker = test_reach.start_checker()
        test_reach.configure()
        answer = self.set("5002-5004/tcp", "6000/udp", "6001/udp", "5005/tcp", test=True)
        LAB.end(checker)
        # One of the first is lan2's; the second has a program that does not know the checker; the last is the user's.
        self.assertEqual((answer["result"], [port["status"] for port in answer["ports"]]),
                         (0, ["fail", "not tested", "ok", "ok"]))
        mine = ("hoplink", "HopLink")
        self.kept(*self.users, ("1", "tcp", "5002, 5004", "5002, 5004", *mine), ("1", "udp", "6000", "6000", *mine),
                  ("1", "udp", "6001", "6001", *mine))
        self.mapped(("tcp", 5002), ("tcp", 5004), ("udp", 6000), ("udp", 6001))
        self.reloaded(1)
        for protocol, port in (("tcp", 5002), ("tcp", 5004), ("udp", 6000), ("tcp", 8080), ("tcp", 5005)):
            self.assertTrue(LAB.reaches(protocol, port), port)
        self.assertEqual(self.set("5004/tcp")["result"], 0)
        self.kept(*self.users, ("1", "tcp", "5004", "5004", *mine))
        self.mapped(("tcp", 5004))
        self.assertFalse(LAB.reaches("tcp", 5002))
        self.assertEqual(self.set()["result"], 0)
        self.kept(*self.users)
        self.mapped()
        self.assertTrue(LAB.reaches("tcp", 8080) and not LAB.reaches("tcp", 5004))
        self.reloaded(3)


def prepare(lab):
    lab.write("/etc/init.d/tavorelayd", INIT)
    os.chmod("/etc/init.d/tavorelayd", 0o755)
    lab.serve(5001, 5002, 5003, 5004, 5005, 6000)


if __name__ == "__main__":
    homelab.run_tests(prepare)
