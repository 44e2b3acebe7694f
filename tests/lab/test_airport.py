"""The list of AirPort base stations: a real mDNS announcement from the router, avahi on the box."""
import os
import time
import unittest

from homelab import GATEWAY, LAN2, run_tests, wait_for

LAB = None
LIST = "/tmp/airport.tcp.local"
HOSTILE = 'x"]\n[192.168.77.9]\nname="y'


def sections():
    return LAB.read(LIST).split("\n\n")[:-1] if os.path.exists(LIST) else []


def section(address, name):
    return f'[{address}]\nname="{name}"'


class Airport(unittest.TestCase):
    def setUp(self):
        self.bus, self.publisher = LAB.start_avahi()

        self.stations = []

    def tearDown(self):
        for station in self.stations:
            LAB.end(station)
        LAB.restart_avahi("stop")
        self.publisher.terminate()
        self.publisher.wait(5)
        LAB.end(self.bus)

    def publish(self, host, name):
        self.stations.append(LAB.publish_airport(host, name))
        return self.stations[-1]

    def announced(self, wanted, seconds=10):
        wait_for(lambda: sorted(sections()) == sorted(wanted), seconds, f"{wanted}, not {sections()}")

    def test_names_come_as_one_value_each_and_go_with_the_station(self):
        long_name = "ä" * 31 + "b"  # 63 bytes, as much as a label holds
        table = (("Living room", "Living room"), (long_name, long_name), ("a\\b\tc $(id) `id` '", "a\\\\bc $(id) `id` '"),
                 (HOSTILE, 'x\\"][192.168.77.9]name=\\"y'))
        for name, written in table:
            with self.subTest(name=name):
                station = self.publish("router", name)
                self.announced([section(GATEWAY, written)])
                station.terminate()
                wait_for(lambda: not os.path.exists(LIST), 10, "the list goes with the last station")
                station.wait()

    def test_a_fresh_list_after_a_restart_of_avahi(self):
        self.publish("router", "One")
        other = self.publish("lan2", "Two")
        both = [section(GATEWAY, "One"), section(LAN2, "Two")]
        self.announced(both)
        other.kill()  # without a goodbye: only a new question finds that it is gone
        for _ in range(3):
            os.unlink(LIST)
            LAB.restart_avahi()
            wait_for(lambda: section(GATEWAY, "One") in sections(), 2, "the list is back in time")
        self.announced(both[:1])

    def test_outlives_avahi_and_the_bus(self):
        self.publish("router", "One")
        self.announced([section(GATEWAY, "One")])
        LAB.restart_avahi("stop")
        wait_for(lambda: not os.path.exists(LIST), 5, "no avahi, no list")
        LAB.end(self.bus)
        start = time.monotonic()
        wait_for(lambda: time.monotonic() > start + 2.5, 5, "some tries without a bus")
        self.assertIsNone(self.publisher.poll())
        with open(f"/proc/{self.publisher.pid}/stat", encoding="ascii") as file:
            ticks = sum(map(int, file.read().rsplit(")", 1)[1].split()[11:13]))
        self.assertLess(ticks, 20, "it waits without spinning")
        self.bus = LAB.start_bus()
        LAB.restart_avahi("start")
        self.announced([section(GATEWAY, "One")])

    def test_a_trap_in_its_place(self):
        LAB.write("/tmp/victim", "untouched")
        self.publish("router", "One")
        self.announced([section(GATEWAY, "One")])
        os.unlink(LIST)
        os.symlink("/tmp/victim", LIST)
        self.publish("lan2", "Two")
        self.announced([section(GATEWAY, "One"), section(LAN2, "Two")])
        self.assertFalse(os.path.islink(LIST))
        self.assertEqual(LAB.read("/tmp/victim"), "untouched")
        self.publisher.terminate()
        self.assertEqual(self.publisher.wait(5), 0)
        self.assertFalse(os.path.lexists(LIST), "an ended publisher leaves nothing")


if __name__ == "__main__":
    run_tests(lambda lab: None)
