"""What the box finds out about the router, in every network that it may find itself in."""
import json
import os
import signal
import unittest

import homelab
import networks
from homelab import BUILD, GATEWAY, LAN2, sh, wait_for

LAB = OUTSIDE = None
WHOLE = [10, 20, 30, 40, 70, 50, 80, 80]
NO, YES, UNKNOWN = 0, 1, 2
TASK = "/var/lib/tavo/tasks/@system/.upnp_detector.json"


def start(*arguments):
    return LAB.start("box", f"{BUILD}/tests/lab/detector", *arguments, stdout=homelab.subprocess.PIPE, text=True)


def detect(*arguments):
    out, _ = start(*arguments).communicate(timeout=60)
    return json.loads(out)


class Detection(unittest.TestCase):
    def setUp(self):
        LAB.install()
        OUTSIDE.settings()

    def tearDown(self):
        if LAB.router is not None:
            LAB.stop_router()
        LAB.router = None

    def expect(self, found, **wanted):
        self.assertEqual({key: found[key] for key in wanted}, wanted)

    def test_router_of_the_database(self):
        LAB.start_router()
        first = detect()
        self.expect(first, result=0, upnp=UNKNOWN, natpmp=NO, max=-1, progress=WHOLE, end=100, level=1, flags=0,
                    gateway=GATEWAY, interface="box0")
        self.assertTrue(first["brand"] and first["model"])
        key = "/".join((first["brand"], first["model"], first["version"]))
        LAB.write("/etc/portforward/router_upnp.db", f'[{key}]\nsupport="yes"\nmax="48"\n')
        self.expect(detect(), result=0, upnp=YES, max=48, brand=first["brand"])

    def test_first_steps_with_the_tool(self):
        """From a router that no database knows to an open port, by the commands that the answers name."""
        tool = f"{BUILD}/cli/tavoportmap"
        self.addCleanup(LAB.clear_state, "/etc/portforward/router_upnp.db.user")
        LAB.serve(5002)
        LAB.start_router()
        sh("rm -f /etc/portforward/router.conf /etc/portforward/rule.conf")
        self.assertIn("--last --save --trust-upnp", LAB.run("box", f"{tool} detect").stdout)
        LAB.run("box", f"{tool} detect --last --save --trust-upnp")
        LAB.run("box", f"{tool} rules add web --router-port 5001 --box-port 5002")
        self.assertFalse(LAB.reaches("tcp", 5001))
        self.assertIn("1 rule in force", LAB.run("box", f"{tool} save").stdout)
        self.assertTrue(LAB.reaches("tcp", 5001))
        self.assertIn("upnpd runs", LAB.run("box", f"{tool} status").stdout)
        LAB.run("box", f"{tool} rules remove 1")
        LAB.run("box", f"{tool} save")
        wait_for(lambda: not LAB.mappings(), 10, "the mapping is taken away")
        LAB.stop_daemon()

    def test_gateways_that_are_none(self):
        """No protocol; another device's; a forged address; each ends without UPnP."""
        for title, arguments in (("neither protocol", None), ("another device", ("none", 5000, "lan2", LAN2)),
                                 ("forged location", ("location_other_host",)),
                                 ("location on this box", ("location_loopback",))):
            with self.subTest(title):
                if arguments:
                    LAB.start_scripted(*arguments)
                self.expect(detect(), result=0, upnp=NO, natpmp=NO, max=-1, brand="", progress=WHOLE)
                if arguments:
                    state = LAB.scripted(5000, arguments[3] if len(arguments) > 3 else GATEWAY)
                    self.assertTrue(state["count"]["ssdp"])
                    self.assertNotIn("/d.xml", state["count"])
                    LAB.end(LAB.router)
                    LAB.router = None

    def test_broken_networks(self):
        LAB.start_router()
        sh("ip -n box route del default")
        try:
            self.expect(detect(), result=-1, err=3, flags=1, gateway="", progress=[10, 20, 30, 40, 40], end=40)
        finally:
            sh(f"ip -n box route add default via {GATEWAY}")
        OUTSIDE.stop_names()
        try:
            self.expect(detect(), result=-1, err=4, progress=[10, 20, 30, 40, 70, 50, 50])
        finally:
            OUTSIDE.start_names()
        sh("ip -n router link set wan0 down")
        try:
            self.expect(detect(), result=-1, err=3, flags=0, progress=[10, 20, 30, 40, 40])
        finally:
            sh("ip -n router link set wan0 up")
        sh("ip -n box link set box0 down")
        try:
            self.expect(detect(), result=-1, err=0, progress=[10, 20, 20])
        finally:
            sh(f"ip -n box link set box0 up && ip -n box route add default via {GATEWAY}")

    def test_base_station(self):
        for maximum, support in (("", UNKNOWN), ('support="yes"\nmax="20"\n', YES)):
            LAB.write("/etc/portforward/router_upnp.db", f"[AirPort//]\n{maximum}[Lab/One/1]\nmax=1\n")
            station = LAB.publish_airport("router", "Living \"room\"]")
            try:
                self.expect(detect(), result=0, upnp=NO, natpmp=support, brand="AirPort" if support == YES else "",
                            name='Living "room"]' if support == YES else "", max=20 if support == YES else -1)
            finally:
                LAB.end(station)

    def test_two_routers_in_a_row(self):
        for prefix in ("10.64.0", "100.64.0"):
            for upnp in (True, False):
                with self.subTest(prefix=prefix, upnp=upnp):
                    networks.insert_outer(LAB, prefix)
                    try:
                        if upnp:
                            LAB.start_router()
                        self.expect(detect(), result=0, level=2, flags=4, upnp=UNKNOWN if upnp else NO)
                    finally:
                        self.tearDown()
                        networks.remove_outer(LAB)

    def test_hostile_names_end_up_as_one_value(self):
        LAB.start_scripted("hostile_brand")
        found = detect()
        self.expect(found, result=0, upnp=UNKNOWN, model="Scripted", version="7")
        self.assertLess(len(found["brand"]), 64)
        self.assertFalse([c for c in found["brand"] if ord(c) < 32])
        with open(TASK, encoding="utf-8") as file:
            self.assertIn(found["brand"], json.load(file).values())

    def test_killed_in_the_middle_the_last_record_stays(self):
        LAB.start_router()
        brand = detect()["brand"]
        before = LAB.read(TASK)
        LAB.stop_router()  # the next one searches for a while
        signal_file = "/tmp/detecting"
        running = start(signal_file)
        wait_for(lambda: os.path.exists(signal_file), 30, "the detectors have begun")
        second = detect()
        self.expect(second, result=-1, err=2, progress=[10, 10])
        sh(f"kill -9 $(ps -o pid= --ppid {running.pid}) {running.pid}")
        running.wait()
        os.unlink(signal_file)
        self.assertEqual(LAB.read(TASK), before)
        self.expect(detect("last"), brand=brand)
        LAB.start_router()
        self.expect(detect(), result=0, brand=brand)


def prepare(lab):
    global LAB, OUTSIDE
    LAB, OUTSIDE = lab, networks.Outside(lab)


if __name__ == "__main__":
    homelab.run_tests(prepare)
