"""Rules saved through NAT-PMP: on the real router, and on gateways with faults."""
import contextlib
import json
import os
import re
import signal
import time
import unittest

import homelab
from homelab import BOX, LAN2, only_box, wait_for

LAB = None
MADE = "/var/lib/tavo/natpmp_made.conf"


class RealRouter(homelab.Case):
    def setUp(self):
        LAB.install(natpmp=True)
        LAB.start_router()

    def owners(self):
        """Who made the mappings of the box, by the descriptions that the router keeps."""
        listing = LAB.run("lan2", "upnpc -l", check=False).stdout
        return {m[1].split(" ")[0].split(":")[0] for m in re.finditer(rf"->{BOX}:\d+ +'([^']*)'", listing)}

    def test_three_saves_in_a_row(self):
        LAB.map_foreign(9999)
        probes = [(protocol, port) for protocol in ("tcp", "udp") for port in (5001, 6001, 7001, 7002, 8001)]
        for rules, wanted in (
                (("1,1,tcp,5001,5001", "2,1,udp,6001,5002", "3,1,all,7001-7002,5003-5004", "4,0,tcp,8001,5001"),
                 {("tcp", 5001): 5001, ("udp", 6001): 5002, ("tcp", 7001): 5003, ("udp", 7001): 5003,
                  ("tcp", 7002): 5004, ("udp", 7002): 5004}),
                (("1,1,tcp,6001,5001", "2,1,tcp,5001,5002", "3,1,udp,7001,5003"),
                 {("tcp", 6001): 5001, ("tcp", 5001): 5002, ("udp", 7001): 5003}),
                ((), {})):
            with self.subTest(rules=rules):
                answer = LAB.save(*rules)
                self.assertEqual((answer["result"], answer["status"]), (0, 0), answer["ports"])
                wait_for(lambda: only_box(LAB.mappings()) == wanted, 10, f"{wanted}, not {LAB.mappings()}")
                self.assertEqual(LAB.mappings()[("tcp", 9999)], (LAN2, 9999))
                self.assertEqual([probe for probe in probes if LAB.reaches(*probe)],
                                 [probe for probe in probes if probe in wanted])

    def test_what_cannot_be_had_is_told_and_nothing_else_opened(self):
        LAB.map_foreign(5001)
        answer = LAB.save("1,1,tcp,5001,5001", "2,1,tcp,5003,5002", "3,1,tcp,6002,5002", "4,1,tcp,7001-7003,1-2")
        self.assertEqual((answer["result"], answer["status"]), (-1, 8))
        offered = re.fullmatch(r"5001/tcp \(the router offered (\d+)\), 6002/tcp \(another rule has this port of the "
                               r"box; .*\), 7001-7003/tcp \(invalid\)", answer["ports"])
        self.assertTrue(offered, answer["ports"])
        self.assertEqual(LAB.mappings(), {("tcp", 5001): (LAN2, 5001), ("tcp", 5003): (BOX, 5002)})
        self.assertFalse(LAB.reaches("tcp", int(offered[1])))

    def test_killed_daemon_takes_stale_mappings_away_when_it_is_back(self):
        for crash in (lambda: os.kill(LAB.daemon_pid("natpmpd"), signal.SIGKILL),  # its parent starts it again
                      lambda: LAB.stop_daemon(signal.SIGKILL)):
            LAB.save("1,1,tcp,5001,5001", "2,1,udp,5002,5002")
            crash()
            self.assertEqual(LAB.save("2,1,udp,5002,5002")["result"], 0)
            self.assertEqual(LAB.mappings(), {("udp", 5002): (BOX, 5002)})
        LAB.write("/etc/portforward/rule.conf", "this is no rule file\n")
        LAB.stop_daemon(signal.SIGKILL)
        os.unlink(homelab.REMAP)
        answer = LAB.start("box", "/usr/tavo/sbin/natpmpd")
        self.assertEqual(answer.wait(10), 0)
        wait_for(lambda: os.path.exists(homelab.REMAP), 10, "the pass has ended")
        self.assertEqual(LAB.read(homelab.REMAP), "rule.conf (unreadable)")
        self.assertEqual(LAB.mappings(), {("udp", 5002): (BOX, 5002)})

    def test_stop_and_reboot(self):
        LAB.settings(check_interval=1)
        LAB.save("1,1,tcp,5001,5001")
        LAB.stop_router()
        wait_for(lambda: "5001/tcp (the gateway cannot be reached by NAT-PMP)" in LAB.read(homelab.REMAP), 20,
                 "the loss is noticed")
        LAB.start_router()
        wait_for(lambda: LAB.mappings() == {("tcp", 5001): (BOX, 5001)}, 30, "the mapping is back after the reboot")
        LAB.stop_daemon(signal.SIGTERM)
        self.assertEqual(LAB.mappings(), {})
        self.assertFalse(os.path.exists("/var/run/natpmpd.pid"))

    def test_switching_between_the_daemons_leaves_the_mappings_of_one(self):
        rules = [f"{i},1,tcp,{5000 + i},{5000 + i}" for i in range(1, 21)]
        wanted = {("tcp", 5000 + i): (BOX, 5000 + i) for i in range(1, 21)}
        for natpmp in (True, False, True, False):
            LAB.router_conf(natpmp=natpmp)
            self.assertEqual(LAB.save(*rules)["result"], 0)
            self.assertEqual(LAB.mappings(), wanted)
            self.assertEqual(self.owners(), {"NAT-PMP"} if natpmp else {"tavo"})
        LAB.stop_daemon(signal.SIGTERM, "natpmpd")
        self.assertEqual(LAB.mappings(), wanted)
        LAB.stop_daemon(signal.SIGTERM, "upnpd")
        self.assertEqual(LAB.mappings(), {})


class FaultyGateway(unittest.TestCase):
    """Each fault: status, what the user reads, the gateway's table afterwards, and a bound in seconds."""
    table = (
        ("none", 0, "", {"tcp 5001": 5001}, 4),
        ("lossy", 0, "", {"tcp 5001": 5001}, 6),
        ("late", 0, "", {"tcp 5001": 5001}, 4),
        ("silent", 8, "no answer from the gateway", {}, 12),
        ("closed", 8, "the gateway cannot be reached by NAT-PMP", {}, 4),
        ("garbage", 8, "senseless answers from the gateway", {}, 12),
        ("version", 8, "refused: unsupported version", {}, 4),
        ("refuse 2", 8, "refused: not authorised", {}, 4),
        ("refuse 3", 8, "refused: network failure", {}, 4),
        ("refuse 4", 8, "refused: out of resources", {}, 4),
        ("refuse 5", 8, "refused: unsupported opcode", {}, 4),
        ("refuse 77", 8, "refused: code 77", {}, 4),
        ("other_port", 8, "the router offered 5002", {}, 4),
        ("will_not_close", 8, "the router offered 5002), 5002/tcp (still open: refused: not authorised",
         {"tcp 5001": 5002}, 4),
    )

    @contextlib.contextmanager
    def gateway(self, fault, check_interval=120):
        LAB.install(natpmp=True)
        LAB.settings(check_interval)
        process = LAB.start("router", "/usr/bin/python3", f"{homelab.HERE}/scripted_natpmp.py", *fault.split())
        try:
            wait_for(self.state, 10, "the gateway is up")
            yield process
        finally:
            LAB.stop_daemon(signal.SIGKILL)
            LAB.end(process)
            LAB.clear_state("/tmp/natpmp_gateway.json")

    @staticmethod
    def state():
        try:
            return json.loads(LAB.read("/tmp/natpmp_gateway.json"))
        except FileNotFoundError:
            return None

    def test_faults(self):
        for fault, status, words, table, bound in self.table:
            with self.subTest(fault=fault), self.gateway(fault):
                answer = LAB.save("1,1,tcp,5001,5001", seconds=bound)
                self.assertEqual((answer["status"], answer["ports"]), (status, words and f"5001/tcp ({words})"))
                self.assertEqual(self.state()["table"], table)
                self.assertTrue(self.state()["count"].get("opcode 0") or fault == "closed", "the fault was reached")

    def test_reboots_restore_everything(self):
        for fault, how, check in (("none", signal.SIGUSR1, 120), ("pcp", signal.SIGUSR1, 120), ("none", signal.SIGUSR2, 1)):
            with self.subTest(fault=fault, how=how), self.gateway(fault, check) as gateway:
                LAB.save("1,1,tcp,5001,5001", "2,1,udp,5002,5002")
                gateway.send_signal(how)
                wait_for(lambda: self.state()["count"].get("boot"), 5, "the reboot")
                back = lambda: self.state()["table"] == {"tcp 5001": 5001, "udp 5002": 5002}
                wait_for(back, 5, "all is back")
                if how == signal.SIGUSR1:  # once more, so soon that its clock does not show it
                    gateway.send_signal(signal.SIGUSR2)
                    wait_for(lambda: self.state()["count"]["boot"] == 2, 5, "the second one")
                    wait_for(back, 15, "all is back again")

    def test_leases_are_renewed_at_half_of_what_is_granted_whatever_else_is_refused(self):
        for lease, pause in ((12, 6), (1, 5)):  # never faster than every five seconds, and then it is said
            with self.subTest(lease=lease), self.gateway(f"short_lease {lease}"):
                LAB.save("1,1,tcp,5001,5001", "2,1,tcp,5002,5002")
                begin, first = time.monotonic(), self.state()["count"]["opcode 2"]
                wait_for(lambda: self.state()["count"]["opcode 2"] >= first + 4, 3 * pause, "two renewals")
                self.assertGreater(time.monotonic() - begin, 2 * pause - 1)
                why = json.loads(LAB.read("/run/tavo/natpmpd.json"))["rules"][0].get("why", "")
                self.assertEqual("1 seconds at a time" in str(why), lease == 1, why)

    def test_what_upnpd_could_not_take_away_when_it_was_switched_off_goes_later_and_nothing_else(self):
        cut = ("'add table inet cut; add chain inet cut in { type filter hook input priority -10; }; "
               f"add rule inet cut in iifname br0 ip saddr {BOX} drop'")
        new = ("2,1,tcp,5002,5002", "3,1,tcp,5003,5003")
        upnp = lambda: {row[1] for row in LAB.scripted()["table"]}
        left = lambda: [row["name"] for row in json.loads(LAB.read("/run/tavo/upnpd.json"))["left_over"]]

        def away():
            LAB.run("router", "nft " + cut)
            LAB.save(*new, seconds=120)
            wait_for(lambda: left() == ["5001/tcp"], 40, "it is named")
            said = json.loads(LAB.run("box", f"{homelab.BUILD}/cli/tavoportmap status --json", check=False).stdout)
            self.assertIn("5001/tcp", [row["name"] for row in said["left_over"]])
            LAB.run("router", "nft delete table inet cut")

        def crash():
            LAB.run("box", f"curl -s http://{homelab.GATEWAY}:5000/hang?6")
            saving = LAB.start_save(*new)
            time.sleep(1.5)
            os.kill(LAB.daemon_pid("upnpd"), signal.SIGKILL)
            saving.communicate(timeout=120)

        for switch in (away, crash):
            with self.subTest(switch=switch), self.gateway("none", 5), contextlib.ExitStack() as after:
                LAB.router_conf(natpmp=False)
                LAB.start_scripted("only_permanent")
                after.callback(LAB.end, LAB.router)
                after.callback(LAB.run, "router", "nft delete table inet cut", check=False)
                LAB.save("1,1,tcp,5001,5001", "2,1,tcp,5002,5002")
                self.assertEqual(upnp(), {5001, 5002})
                LAB.router_conf(natpmp=True)
                switch()
                wait_for(lambda: 5001 not in upnp() and left() == [], 40, "what no rule asks for is gone")
                wait_for(lambda: set(self.state()["table"]) == {"tcp 5002", "tcp 5003"}, 40, "and what they ask for is there")
                self.assertTrue(switch != away or upnp() == {5002}, "which may be the same mapping")
                LAB.save("3,1,tcp,5003,5003")
                wait_for(lambda: upnp() == set(), 20, "the last of it has gone with its rule")

    def test_a_silent_gateway_does_not_hold_a_stop_and_what_is_held_stays_known(self):
        with self.gateway("none") as gateway:
            LAB.save("1,1,tcp,5001,5001")
            gateway.send_signal(signal.SIGSTOP)
            begin = time.monotonic()
            LAB.stop_daemon(signal.SIGTERM)
            self.assertLess(time.monotonic() - begin, 12)
            self.assertIn("5001", LAB.read(MADE))


if __name__ == "__main__":
    homelab.run_tests(lambda lab: lab.serve(5001, 5002, 5003, 5004))
