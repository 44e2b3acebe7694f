"""The world moves while rules are in force: the box's address, and routers that forget, rewrite, or are slow to tell."""
import json
import os
import signal
import time

import homelab
from homelab import BOX, GATEWAY, sh, wait_for

LAB = None
NEW = "192.168.77.5"
PUBLISHED = "/run/tavo/upnpd.json"


def state():
    return json.loads(LAB.read(PUBLISHED))


def own_address(new, old):
    sh(f"ip -n box addr add {new}/24 dev box0 && ip -n box addr del {old}/24 dev box0 && "
       f"ip -n box route replace default via {GATEWAY}")


class World(homelab.Case):
    def setUp(self):
        LAB.install()
        LAB.settings(check_interval=1, lease=20)

    def test_the_box_has_another_address(self):
        """A router that lets nobody else delete an entry keeps the old one until its lease ends, and that is said."""
        LAB.settings(lease=20)  # two minutes between looks
        LAB.start_router()
        self.assertEqual(LAB.save("1,1,tcp,5001,5001")["status"], 0)
        self.assertTrue(LAB.reaches("tcp", 5001))
        own_address(NEW, BOX)
        try:
            wait_for(lambda: "former address" in LAB.read(PUBLISHED), 10, "what is waited for is said")
            row = state()["rules"][0]
            self.assertEqual((row["state"], row["word"]), ("waiting", "606"))
            self.assertTrue(0 < row["until"] - time.time() < 21, row)
            wait_for(lambda: LAB.mappings() == {("tcp", 5001): (NEW, 5001)}, 40, "it leads to the new address")
            self.assertLess(time.time(), row["until"] + 9, "and is made at that time")
            self.assertTrue(LAB.reaches("tcp", 5001))
            LAB.stop_daemon(signal.SIGTERM)
            self.assertEqual(LAB.mappings(), {})
        finally:
            own_address(BOX, NEW)

    def test_the_box_has_two_addresses(self):
        """As on cable and Wi-Fi: the way out is another one, and the one of before is still there to ask from."""
        for daemon in ("upnpd", "natpmpd"):
            with self.subTest(daemon=daemon):
                LAB.install(natpmp=daemon == "natpmpd")
                LAB.settings(check_interval=1, lease=600)
                LAB.start_router()
                self.assertEqual(LAB.save("1,1,tcp,5001,5001")["status"], 0)
                way = "ip -n box route replace 192.168.77.0/24 dev box0 scope link src"
                sh(f"ip -n box addr add {NEW}/24 dev box0 && {way} {NEW}")
                try:
                    wait_for(lambda: LAB.mappings() == {("tcp", 5001): (NEW, 5001)}, 10, "it leads to the new address")
                    self.assertTrue(LAB.reaches("tcp", 5001))
                    LAB.stop_daemon(signal.SIGTERM)
                    self.assertEqual(LAB.mappings(), {})
                finally:
                    sh(f"{way} {BOX} && ip -n box addr del {NEW}/24 dev box0")
                self.tearDown()
                self.setUp()

    def in_peace(self):
        """What the daemon has published when it will not look of its own accord for a while."""
        LAB.settings(check_interval=3600)
        self.assertEqual(LAB.save("1,1,tcp,5001,5001")["status"], 0)
        wait_for(lambda: state()["next_look"] - time.time() > 25, 60, "peace")
        return state()

    def test_a_router_that_restarts_and_says_so(self):
        LAB.start_router()
        quiet = self.in_peace()
        LAB.reboot_router()
        wait_for(lambda: LAB.mappings() == {("tcp", 5001): (BOX, 5001)}, 15, "it is open again")
        self.assertLess(time.time(), quiet["next_look"] - 3, "before it would have looked")
        self.assertTrue(LAB.reaches("tcp", 5001))

    def test_an_entry_that_somebody_takes_away_is_back_at_once(self):
        """The router tells; nobody else can."""
        LAB.start_router(secure=False)
        quiet = self.in_peace()
        listener = next(line.split()[3] for line in LAB.run("box", "ss -Hltnp").stdout.splitlines() if '"upnpd"' in line)
        self.assertTrue(listener.startswith(BOX + ":"), "nothing is heard elsewhere")
        answer = LAB.run("lan2", "curl -s -m 3 -X NOTIFY -H 'SID: uuid:1' -H 'SEQ: 1' -d '<PortMappingNumberOfEntries>0"
                         f"</PortMappingNumberOfEntries>' http://{listener}/", check=False)
        self.assertNotEqual(answer.returncode, 0)
        self.assertEqual(answer.stdout, "", "a neighbour gets no word")
        time.sleep(7)
        self.assertEqual(state(), quiet, "and wakes nobody")
        LAB.run("lan2", "upnpc -d 5001 tcp")
        wait_for(lambda: LAB.mappings() == {("tcp", 5001): (BOX, 5001)}, 10, "it is open again")
        self.assertLess(time.time(), quiet["next_look"] - 3, "before it would have looked")
        LAB.stop_daemon(signal.SIGTERM)
        self.assertEqual(LAB.mappings(), {})

    def test_the_box_has_another_address_by_natpmp(self):
        """A gateway knows a client by its address: the old mapping lasts until its lease ends, and is named till then."""
        LAB.install(natpmp=True)
        LAB.settings(check_interval=1, lease=20)
        LAB.start_router()
        self.assertEqual(LAB.save("1,1,tcp,5001,5001", "2,1,tcp,5002,5002")["status"], 0)
        own_address(NEW, BOX)
        published = "/run/tavo/natpmpd.json"
        try:
            wait_for(lambda: "former address" in LAB.read(published), 10, "what is waited for is said")
            self.assertNotEqual(LAB.save("2,1,tcp,5002,5002")["result"], 0, "5001 is still open")
            self.assertEqual([(row["name"], row["address"]) for row in json.loads(LAB.read(published))["left_over"]],
                             [("5001/tcp", BOX)], "the former address, as it leads there")
            wait_for(lambda: LAB.mappings() == {("tcp", 5002): (NEW, 5002)}, 40, "it leads to the new address")
            LAB.stop_daemon(signal.SIGTERM)
            self.assertEqual(LAB.mappings(), {})
        finally:
            own_address(BOX, NEW)

    def test_a_change_of_the_network_is_noticed_at_once(self):
        LAB.start_router(secure=False)
        self.in_peace()
        own_address(NEW, BOX)
        try:
            wait_for(lambda: LAB.mappings() == {("tcp", 5001): (NEW, 5001)}, 6, "it leads to the new address")
        finally:
            own_address(BOX, NEW)
        wait_for(lambda: LAB.mappings() == {("tcp", 5001): (BOX, 5001)}, 6, "and back")
        for down, up, word, bound in (
                ("ip -n box route del default", f"ip -n box route add default via {GATEWAY}", "no_gateway", 6),
                ("ip -n router link set box1 down", "ip -n router link set box1 up", "unreachable", 20)):
            sh(down)
            try:
                wait_for(lambda: state()["router"] == word, bound, word)
            finally:
                sh(up)
            wait_for(lambda: state()["router"] == "ok", 9, "and back")
        self.assertTrue(LAB.reaches("tcp", 5001))

    def test_a_router_stays_itself_when_its_hardware_is_forgotten(self):
        """As after a cable that was out. What was made at another device of its address is not looked for here."""
        made = "/var/lib/tavo/upnp_made.conf"
        os.makedirs(os.path.dirname(made), exist_ok=True)
        LAB.write(made, f'[elsewhere]\ngateway="{GATEWAY}"\nhardware="02:00:00:00:00:99"\nprotocol="TCP"\n'
                        f'router_port="5009"\nbox_port="5009"\nclient="{BOX}"\ntext="x"\nshown="yes"\nlease="0"\n')
        LAB.start_router()
        self.assertEqual(LAB.save("1,1,tcp,5001,5001")["status"], 0)
        for _ in range(4):
            self.assertIn('router_port="5009"', LAB.read(made))
            sh("ip -n box neigh flush dev box0")
            time.sleep(1.5)

    def test_rules_go_with_the_old_address_gone(self):
        LAB.start_router(secure=False)
        self.assertEqual(LAB.save("1,1,tcp,5001,5001")["status"], 0)
        LAB.stop_daemon(signal.SIGKILL)
        own_address(NEW, BOX)
        try:
            self.assertEqual(LAB.save()["result"], 0)
            wait_for(lambda: LAB.mappings() == {}, 10, "nothing leads to whoever gets the old address")
        finally:
            own_address(BOX, NEW)

    def test_a_router_that_rewrites_texts(self):
        LAB.settings(check_interval=1, lease=20)
        LAB.start_scripted("rewrites")
        self.assertEqual(LAB.save("1,1,tcp,5001,5001", "2,1,tcp,5002,5002")["status"], 0)
        wait_for(lambda: LAB.scripted()["count"]["AddPortMapping"] > 2, 15, "leases are renewed")
        os.kill(LAB.daemon_pid(), signal.SIGKILL)  # its parent starts it again
        self.assertEqual(LAB.save("2,1,tcp,5002,5002")["status"], 0)
        self.assertEqual([row[1] for row in LAB.scripted()["table"]], [5002])

    def test_a_router_that_lists_slowly(self):
        LAB.start_scripted("slow_table")
        self.assertEqual(LAB.save("1,1,tcp,5001,5001", seconds=60)["status"], 0)
        self.assertEqual(LAB.save(seconds=60)["result"], 0)
        wait_for(lambda: [row for row in LAB.scripted()["table"] if row[2] == BOX] == [], 30, "ours is gone")

    def test_very_many_ports(self):
        """A listing of some hundred and thirty entries at once ends the router's daemon."""
        LAB.settings()
        LAB.start_router()
        for ports in (150, 1024):
            with self.subTest(ports=ports):
                last = 10000 + ports
                self.assertEqual(LAB.save(f"1,1,tcp,10001-{last},10001-{last}", seconds=200)["status"], 0)
                self.assertEqual(len(LAB.mappings()), ports)
                self.assertEqual(LAB.save(seconds=200)["result"], 0)
                wait_for(lambda: LAB.mappings() == {}, 60, "none is left")


if __name__ == "__main__":
    homelab.run_tests(lambda lab: lab.serve(5001))
