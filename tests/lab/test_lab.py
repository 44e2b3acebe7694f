"""Rules saved on the box, a real router, and a stranger outside who tries to connect."""
import os
import signal
import time

import homelab
from homelab import BOX, GATEWAY, LAN2, only_box, wait_for

LAB = None


class RealRouter(homelab.Case):
    flavours = (False, True)

    def setUp(self):
        LAB.install()
        LAB.start_router()

    def test_three_saves_in_a_row(self):
        steps = (
            (("1,1,tcp,5001,5001", "2,1,udp,6001,5002", "3,1,all,7001-7002,5003-5004", "4,0,tcp,8001,5001"),
             {("tcp", 5001): 5001, ("udp", 6001): 5002, ("tcp", 7001): 5003, ("udp", 7001): 5003,
              ("tcp", 7002): 5004, ("udp", 7002): 5004}),
            (("1,1,tcp,5001,5002", "2,1,tcp,6001;6003,5003-5004"),
             {("tcp", 5001): 5002, ("tcp", 6001): 5003, ("tcp", 6003): 5004}),
            ((), {}))
        probes = [(protocol, port) for protocol in ("tcp", "udp") for port in (5001, 6001, 7001, 7002, 6003, 8001)]
        for version1 in self.flavours:
            LAB.reboot_router(version1=version1)
            LAB.map_foreign(9999)
            for rules, wanted in steps:
                with self.subTest(version1=version1, rules=rules):
                    answer = LAB.save(*rules)
                    self.assertEqual((answer["result"], answer["status"]), (0, 0))
                    self.assertEqual(answer["progress"],
                                     [20, 40, 60, 80, 90, 100] if rules else [20, 40, 60, 80, 100])
                    wait_for(lambda: only_box(LAB.mappings()) == wanted, 10, f"{wanted}, not {LAB.mappings()}")
                    self.assertEqual(LAB.mappings()[("tcp", 9999)], (LAN2, 9999))
                    self.assertEqual([probe for probe in probes if LAB.reaches(*probe)],
                                     [probe for probe in probes if probe in wanted])
            LAB.stop_daemon(signal.SIGKILL)

    def test_a_port_that_another_host_holds(self):
        LAB.map_foreign(5001)
        answer = LAB.save("1,1,tcp,5001,5001", "2,1,tcp,5002,5002")
        self.assertEqual((answer["result"], answer["status"], answer["ports"]), (-1, 8, "5001/tcp"))
        self.assertEqual(LAB.mappings(), {("tcp", 5001): (LAN2, 5001), ("tcp", 5002): (BOX, 5002)})
        self.assertIn("0x13100022 The router already uses these ports for something else: 5001/tcp",
                      LAB.read("/var/log/tavo/event.log"))

    def test_unreadable_rule_and_router_files_are_kept(self):
        LAB.write("/etc/portforward/router.conf", "this is no router file\n")
        answer = LAB.save("1,1,tcp,5001,5001")
        self.assertEqual((answer["result"], answer["status"], answer["progress"]), (-1, 0, [20, 40]))
        self.assertEqual(LAB.read("/etc/portforward/router.conf"), "this is no router file\n")


class FaultyRouter(homelab.Case):
    """Each fault: the ports saved, status, refused ports, why, entries of the box, and a bound in seconds."""
    one, many = range(5001, 5002), range(5001, 5041)
    table = (
        ("none", one, 0, "", {}, 1, 5),
        ("conflict_foreign", range(5001, 5003), 8, "5001/tcp", {"5001/tcp": "718"}, 1, 5),
        ("conflict_secure", range(5001, 5003), 8, "5001/tcp", {"5001/tcp": "718"}, 1, 5),
        ("only_permanent", many, 0, "", {}, 40, 10),
        ("invalid_args_402", one, 0, "", {}, 1, 5),
        ("action_failed_501", one, 9, "5001/tcp", {"5001/tcp": "501"}, 0, 5),
        ("full_at_32", many, 9, ", ".join(f"{port}/tcp" for port in range(5033, 5041)),
         {"5033/tcp": "lost"}, 32, 10),
        ("keeps_nothing", one, 9, "5001/tcp", {"5001/tcp": "lost"}, 0, 5),
        ("lease_cut", one, 0, "", {}, 1, 5),
        ("late_reply", range(5001, 5005), 9, "5001/tcp, 5002/tcp, 5003/tcp, 5004/tcp", {"5004/tcp": "timeout"}, None, 25),
        ("endless_table", one, 0, "", {}, 1, 5),
        ("dies_listing", one, 0, "", {}, 2, 10),  # ours is asked for by name; of the old one nobody knows
        ("gives_nothing_back", one, 9, "2/tcp (left over)", {"2/tcp (left over)": "606"}, 2, 5),
        ("drips_actions", many, 9, ", ".join(f"{port}/tcp" for port in many), {"5040/tcp": "timeout"}, None, 25),
        ("many_services", one, 0, "", {}, 1, 5),
        ("ssdp_flood", one, 0, "", {}, 1, 15),
        ("bad_descriptions", one, 0, "", {}, 1, 20),
        ("silent", one, 9, "5001/tcp", {"5001/tcp": "noigd"}, 0, 25),
        ("drip", one, 9, "5001/tcp", {"5001/tcp": "noigd"}, 0, 25),
        ("half_reply", one, 9, "5001/tcp", {"5001/tcp": "noigd"}, 0, 25),
        ("dies_of_ranges", many, 0, "", {}, 40, 10),
        ("location_other_host", one, 0, "", {"5001/tcp": "1"}, 1, 25),
        ("location_loopback", one, 0, "", {"5001/tcp": "1"}, 1, 25),
    )

    def test_faults(self):
        for fault, ports, status, refused, why, entries, bound in self.table:
            with self.subTest(fault=fault):
                LAB.install()
                LAB.start_scripted(fault)
                try:
                    answer = LAB.save(*(f"{port},1,tcp,{port},{port}" for port in ports), seconds=bound)
                    self.assertEqual((answer["status"], answer["ports"]), (status, refused))
                    self.assertEqual(why, {key: value for key, value in LAB.status().items() if key in why})
                    state = LAB.scripted()
                    self.assertTrue(state["count"].get("ssdp"), "the fault was reached")
                    ours = [row for row in state["table"] if row[2] == BOX]
                    if entries is not None:
                        self.assertEqual(len(ours), entries)
                    if fault.startswith("location"):  # wherever it leads, it is read at the gateway
                        self.assertIn("/d.xml", state["count"])
                    if fault == "dies_of_ranges":  # it is asked once, also by the next process
                        LAB.stop_daemon(signal.SIGKILL)
                        LAB.save(*(f"{port},1,tcp,{port},{port}" for port in ports[:20]), seconds=bound)
                        self.assertEqual(LAB.scripted()["count"]["GetListOfPortMappings"], 1)
                    if fault == "only_permanent":  # learnt once, not once a rule
                        self.assertEqual(state["count"]["AddPortMapping"], 41)
                    if fault == "bad_descriptions":  # each was tried, and none kept the good one from being found
                        self.assertGreaterEqual(sum(path.startswith("/") for path in state["count"]), 12)
                finally:
                    self.tearDown()

    def test_a_stop_goes_on_while_the_router_answers(self):
        LAB.install()
        LAB.start_scripted("slow")
        self.assertEqual(LAB.save(*(f"{port},1,tcp,{port},{port}" for port in range(5001, 5008)), seconds=40)["status"], 0)
        LAB.stop_daemon(signal.SIGTERM)
        self.assertEqual(LAB.scripted()["table"], [])

    def test_a_stop_keeps_its_bound_whatever_the_router_does(self):
        """For so many seconds the router answers nothing; what is left of the mapping, if it is known."""
        for hang, left in ((0, 0), (4, 0), (60, 1)):
            with self.subTest(hang=hang):
                LAB.install()
                LAB.start_scripted("none")
                self.assertEqual(LAB.save("1,1,tcp,5001,5001")["status"], 0)
                LAB.run("box", f"curl -s http://{GATEWAY}:5000/hang?{hang}")
                os.kill(LAB.daemon_pid(), signal.SIGHUP)  # the stop comes in the middle of a pass
                start = time.monotonic()
                LAB.stop_daemon(signal.SIGTERM)
                self.assertLess(time.monotonic() - start, 12)
                self.assertEqual(len(LAB.scripted()["table"]), left)
                self.tearDown()


if __name__ == "__main__":
    homelab.run_tests(lambda lab: lab.serve(5001, 5002, 5003, 5004))
