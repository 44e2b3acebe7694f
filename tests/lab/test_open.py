"""Ports opened, closed and kept as drafts by the tool, on a router that does as it is told and on those that do not:
what the tool says is what the router does."""
import os
import signal
import subprocess
import unittest

import homelab
from homelab import TOOL, only_box, wait_for

LAB = None
OK, FAILED, REFUSED, AWAY = 0, 1, 4, 6
STATE = ("/etc/tavoinfo.conf", "/var/lib/tavo/run_keys.conf", "/etc/portforward/rule.conf.draft",
         "/etc/portforward/rules.off")


class Case(unittest.TestCase):
    def setUp(self):
        LAB.install()
        LAB.settings(check_interval=1)

    def tearDown(self):
        LAB.stop_daemon(signal.SIGKILL)
        LAB.stop_router()
        LAB.clear_state(*STATE)

    def tool(self, command, code=OK, pattern="."):
        run = LAB.run("box", f"{TOOL} {command}", check=False)
        self.assertEqual(run.returncode, code, f"{command}: {run.stdout}{run.stderr}")
        self.assertRegex(run.stdout + run.stderr, pattern, command)

    @staticmethod
    def open_ports():
        return only_box(LAB.mappings())


class RealRouter(Case):
    def setUp(self):
        super().setUp()
        LAB.start_router()

    def test_one_command_each(self):
        for command, pattern, wanted in (
                ("open 8443 --to 5001 --name web", "port 8443 .tcp. is open on the router and leads to port 5001 of this box",
                 {("tcp", 8443): 5001}),
                ("open 8443 --to 5001", "was open already on the router and leads to port 5001", {("tcp", 8443): 5001}),
                ("open 6000-6001/udp --to 5001-5002", r"port 6000-6001 .udp. is open",
                 {("tcp", 8443): 5001, ("udp", 6000): 5001, ("udp", 6001): 5002}),
                ("close 6000", "6000/udp closed; 2 rules in force", {("tcp", 8443): 5001, ("udp", 6001): 5002}),
                ("off", "every port is closed, and the rules are kept", {}),
                ("on", "2 rules in force", {("tcp", 8443): 5001, ("udp", 6001): 5002}),
                ("close web", "8443/tcp closed; 1 rule in force", {("udp", 6001): 5002}),
                ("close 6001", "keeps none of ours", {})):
            self.tool(command, OK, pattern)
            self.assertEqual(self.open_ports(), wanted, f"when '{command}' has ended")
            self.assertEqual(LAB.reaches("tcp", 8443), ("tcp", 8443) in wanted, command)

    def test_the_word_on_this_port_is_not_that_on_another(self):
        LAB.map_foreign(9999)
        itself = "itself, which was asked for, is open"
        for command, pattern in (("open 9999", "(?s)9999/tcp +refused(?!.*" + itself + ").*The rule stays"),
                                 ("open 8443", "(?s)9999/tcp +refused.*Port 8443 " + itself),
                                 ("open 9998-9999/tcp", "(?s)9999/tcp +refused(?!.*" + itself + ")"),
                                 ("close 8443", "(?s)9999/tcp +refused.*8443/tcp itself, which was to be closed, is closed")):
            self.tool(command, REFUSED, pattern)
        self.assertEqual(self.open_ports().keys(), {("tcp", 9998)})

    def test_a_lock_that_nobody_can_hold_is_no_operation_that_runs(self):
        self.tool("open 8443")
        homelab.sh("mount --bind /tmp /tmp && mount -o remount,bind,ro /tmp")
        self.addCleanup(homelab.sh, "umount -l /tmp")
        for command in ("open 5001", "close 8443", "rules add web --router-port 80", "detect"):
            self.tool(command, FAILED, "routerconf.lock cannot be opened .Read-only file system")

    def test_nothing_but_a_save_opens_a_port(self):
        self.tool("open 5001")
        self.tool("rules add draft --router-port 5002")
        for name, act in (("a signal", lambda: os.kill(LAB.daemon_pid(), signal.SIGHUP)),
                          ("a restart", self.restart),
                          ("a service that asks", lambda: self.tool("service set relay 5003/tcp")),
                          ("a service that leaves", lambda: self.tool("service clear relay")),
                          ("a service that never was", lambda: self.tool("service clear relya", 2, "has no rules")),
                          ("another port", lambda: (self.tool("open 5004"), self.tool("close 5004")))):
            with self.subTest(name):
                act()
                LAB.stop_daemon(signal.SIGTERM)
                self.restart()
                wait_for(lambda: ("tcp", 5001) in self.open_ports(), 10, "what is in force is open")
                self.assertNotIn(("tcp", 5002), self.open_ports(), "the edit waits")
        self.tool("save --dry-run", OK, r"keep +5001/tcp(?s:.)*open +5002/tcp|open +5002/tcp(?s:.)*keep +5001/tcp")
        self.tool("save", OK, "2 rules in force")
        self.assertEqual(self.open_ports(), {("tcp", 5001): 5001, ("tcp", 5002): 5002})

    def restart(self):
        LAB.stop_daemon(signal.SIGTERM)
        self.assertEqual(LAB.start("box", "/usr/tavo/sbin/upnpd").wait(10), 0)

    def test_a_save_that_is_interrupted_goes_on(self):
        LAB.stop_router()  # the daemon looks for it for a while
        self.tool("rules add --router-port 5001")
        run = LAB.start("box", TOOL, "save", stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True)
        while "waiting for it" not in run.stderr.readline():
            self.assertIsNone(run.poll())
        run.send_signal(signal.SIGINT)
        told = run.communicate(timeout=30)[1]
        self.assertEqual(run.returncode, FAILED, told)
        self.assertIn("the waiting is ended, not the save", told)
        LAB.start_router()
        wait_for(lambda: self.open_ports() == {("tcp", 5001): 5001}, 60, "the daemon has gone on")
        self.tool("rules list", OK, r"enabled +tcp +5001 +5001\n")


class NoGoodRouter(Case):
    def test_a_router_that_is_not_there_has_not_refused(self):
        for name, fault, cut, pattern in (
                ("no UPnP", None, "true", "is there, but does not offer UPnP(?s:.)*switch UPnP on"),
                ("unplugged", "none", "ip -n router link set box1 down", "cannot be reached(?s:.)*cable")):
            with self.subTest(name):
                try:
                    if fault:
                        LAB.start_scripted(fault)
                    homelab.sh(cut)
                    self.tool("rules add --router-port 5001")
                    self.tool("save", AWAY, f"{pattern}(?s:.)*tavoportmap status")
                finally:
                    homelab.sh("ip -n router link set box1 up")
                    self.tearDown()
                    self.setUp()


if __name__ == "__main__":
    homelab.run_tests(lambda lab: lab.serve(5001, 5002))
