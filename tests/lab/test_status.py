"""What "tavoportmap status" says of a real router and of what changes around it."""
import json
import re
import signal

import homelab
from homelab import HERE, LAN2, PUBLIC, TOOL, wait_for

LAB = None
OK, REFUSED, AWAY = 0, 4, 6


def status(*arguments):
    """Exit code, and what it says."""
    run = LAB.run("box", f"{TOOL} --json status {' '.join(arguments)}", check=False)
    return run.returncode, json.loads(run.stdout)


def wait_until(code, what, *arguments):
    return wait_for(lambda: (told := status(*arguments))[0] == code and told[1], 30, what)


class Status(homelab.Case):
    def setUp(self):
        LAB.install()
        LAB.settings(check_interval=1)

    def test_it_says_what_the_router_does(self):
        LAB.start_router()
        LAB.map_foreign(5001)
        LAB.save("1,1,tcp,5001,5001", "2,1,udp,6001,5002")
        for arguments in ((), ("--live",)):
            told = wait_until(REFUSED, "one rule is not in force", *arguments)
            self.assertEqual([rule["state"] for rule in told["rules"]], ["refused", "open"])
            self.assertEqual(told["rules"][0]["ports"][0]["holder"], {"address": LAN2, "description": "libminiupnpc"})
        self.assertTrue(LAB.reaches("udp", 6001))
        published = json.loads(LAB.read("/run/tavo/upnpd.json"))
        rows = re.findall(r"(?m)^\| (`.*?) \| (.*) \|$", LAB.read(f"{HERE}/../../docs/file-formats.md").split("`/run/tavo/upnpd.json`")[1].split("What is not")[0])
        self.assertEqual(published.keys(), {name for names, _ in rows for name in re.findall(r"`(\w+)`", names)})
        of_rules = set(re.findall(r"`(\w+)`", dict(rows)["`rules`"]))
        self.assertLessEqual({*published["rules"][0], *published["rules"][0]["holder"]}, of_rules)
        self.assertEqual((told["outside"], told["kept_by"]), ({"address": PUBLIC, "kind": "public"}, "upnpd"))
        table = LAB.run("box", f"{TOOL} router table").stdout
        self.assertRegex(table, rf"5001/tcp +{LAN2}:5001 +\d+ days left +libminiupnpc")
        self.assertRegex(table, r"6001/udp +\S+:5002 +ours +\d+ min left")

        LAB.run("lan2", "upnpc -d 5001 TCP")
        wait_until(OK, "the port is free, and taken")
        self.assertTrue(LAB.reaches("tcp", 5001))
        LAB.stop_router()
        told = wait_until(AWAY, "the router is gone")
        self.assertTrue(told["last_look"]["router_why"])
        self.assertEqual(status("--live")[0], AWAY)
        LAB.start_router()
        wait_until(OK, "the router is back")
        LAB.stop_daemon(signal.SIGKILL)
        code, told = status()
        self.assertEqual((code, {rule["state"] for rule in told["rules"]}), (AWAY, {"not_kept"}))

    def test_a_router_of_which_only_natpmp_is_known(self):
        LAB.install(natpmp=True)
        LAB.settings(check_interval=1)
        LAB.start_router(upnp=False)
        LAB.save("1,1,tcp,5001,5001")
        told = wait_until(OK, "the rule is in force", "--live")
        self.assertEqual((told["kept_by"], told["asked_now"], told["outside"]["address"]), ("natpmpd", None, PUBLIC))
        self.assertIn("cannot be asked", told["warnings"][0])
        run = LAB.run("box", f"{TOOL} router table", check=False)
        self.assertEqual((run.returncode, "'tavoportmap status'" in run.stderr), (1, True))


if __name__ == "__main__":
    homelab.run_tests(lambda lab: lab.serve(5001, 5002))
