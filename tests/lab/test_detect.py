"""What the box finds out about the router, in every network that it may find itself in."""
import json
import os
import unittest

import homelab
import networks
from homelab import BUILD, GATEWAY, LAN2, TOOL, sh, wait_for

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
        LAB.stop_router()
        LAB.stop_daemon()
        LAB.clear_state("/etc/portforward/router_upnp.db.user")

    def announce(self, name):
        self.addCleanup(LAB.end, LAB.publish_airport("router", name))

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

    def test_router_that_is_not_the_gateway(self):
        LAB.start_scripted("none", 5000, "lan2", LAN2)
        self.expect(detect(), result=0, upnp=NO, natpmp=NO, max=-1, brand="", progress=WHOLE, level=1, flags=0)
        state = LAB.scripted(5000, LAN2)
        self.assertTrue(state["count"]["ssdp"])
        self.assertNotIn("/d.xml", state["count"])

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

    def test_base_station_that_no_database_knows(self):
        LAB.write("/etc/portforward/router_upnp.db", "[AirPort//]\n[Lab/One/1]\nmax=1\n")
        self.announce('Living "room"]')
        self.expect(detect(), result=0, upnp=NO, natpmp=UNKNOWN, brand="", name="", max=-1)

    def test_base_station_from_detection_to_an_open_port(self):
        LAB.write("/etc/portforward/router_upnp.db", '[AirPort//]\nsupport="yes"\nmax="20"\n')
        sh("rm -f /etc/portforward/router.conf /etc/portforward/rule.conf")
        LAB.serve(5002)
        LAB.start_router(upnp=False)
        self.announce('Living "room"]')
        LAB.run("box", f"{TOOL} detect --save")
        self.expect(detect("last"), result=0, upnp=NO, natpmp=YES, brand="AirPort", name='Living "room"]', max=20)
        self.assertIn('support_router_natpmp="yes"', LAB.read("/etc/portforward/router.conf"))
        answer = LAB.save("1,1,tcp,5001,5002", "2,1,udp,6001,5002")
        self.assertEqual((answer["result"], answer["status"]), (0, 0))
        self.assertEqual([LAB.reaches(*probe) for probe in (("tcp", 5001), ("udp", 6001), ("tcp", 6001))],
                         [True, True, False])

    def find_two_translations(self, prefix, upnp):
        networks.insert_outer(LAB, prefix)
        self.addCleanup(networks.remove_outer, LAB)
        if upnp:
            LAB.start_router()
        self.expect(detect(), result=0, level=2, flags=4, upnp=UNKNOWN if upnp else NO)

    def test_two_routers_in_a_row(self):
        self.find_two_translations("10.64.0", True)

    def test_two_routers_that_say_nothing(self):
        self.find_two_translations("10.64.0", False)

    def test_translation_of_the_provider(self):
        self.find_two_translations("100.64.0", True)

    def test_translation_of_the_provider_behind_a_router_that_says_nothing(self):
        self.find_two_translations("100.64.0", False)

    def test_table_by_index_and_by_port(self):
        LAB.start_router()
        LAB.map_foreign(9999)
        LAB.map_foreign(9998, "UDP")
        found = json.loads(LAB.run("box", f"{BUILD}/tests/lab/detector table").stdout)
        self.assertCountEqual(found["entries"], [["TCP", 9999, LAN2, 9999], ["UDP", 9998, LAN2, 9998]])
        self.expect(found, end=713, by_port=4, missing=714)
        LAB.stop_router()
        for fault, end in (("endless_table", 713), ("dies_listing", -1)):
            LAB.start_scripted(fault)
            found = json.loads(LAB.run("box", f"{BUILD}/tests/lab/detector table").stdout)
            self.expect(found, end=end)
            self.assertEqual(len(found["entries"]), 1)
            LAB.end(LAB.router)
        LAB.router = None

    def test_hostile_names_end_up_as_one_value(self):
        LAB.start_scripted("hostile_brand")
        found = detect()
        self.expect(found, result=0, upnp=UNKNOWN, model="Scripted", version="7")
        self.assertLess(len(found["brand"]), 64)
        self.assertFalse([c for c in found["brand"] if ord(c) < 32])
        with open(TASK, encoding="utf-8") as file:
            self.assertIn(found["brand"], json.load(file).values())
        shown = LAB.run("box", f"{TOOL} detect --last --save --trust-upnp").stdout
        self.assertEqual([c for c in shown if ord(c) < 32 and c != "\n"], [])
        for path in ("/etc/portforward/router.conf", "/etc/portforward/router_upnp.db.user"):
            lines = LAB.read(path).splitlines()
            self.assertEqual(len([line for line in lines if line.startswith("[")]), 1, lines)
            self.assertEqual([line for line in lines if line.startswith("user=\"me")], [])
        self.expect(detect(), result=0, upnp=YES, brand=found["brand"])

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
    global OUTSIDE
    OUTSIDE = networks.Outside(lab)


if __name__ == "__main__":
    homelab.run_tests(prepare)
