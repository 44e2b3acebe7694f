"""Routers that have web pages only: rules saved on the box, a stranger outside, and pages with faults."""
import json
import os
import re
import signal
import time
import unittest

from homelab import BOX, BUILD, GATEWAY, HERE, LAN2, run_tests, wait_for

LAB = None
TOOL = "/usr/tavo/bin/tavoportforward"
EVENTS = "/var/log/tavo/event.log"
RECORD, EARLIER = "/var/lib/tavo/pages_made.conf", "/var/lib/tavo/manual_router.made"
ACCOUNT = "/etc/portforward/router_account.conf"
COBBLER, LAB_ONE = "--brand Cobbler --model Gate --version 7.3", "--brand Lab --model One --version 1"
FOREIGN = {("tcp", 9999): (LAN2, 9999)}


def events():
    return LAB.read(EVENTS) if os.path.exists(EVENTS) else ""


class Manual(unittest.TestCase):
    web = None

    def setUp(self):
        LAB.install()
        self.forget()

    def tearDown(self):
        LAB.stop_router()

    @staticmethod
    def forget():
        for path in (EVENTS, "/etc/portforward/rule.conf", RECORD, EARLIER):
            if os.path.exists(path):
                os.unlink(path)

    def rows(self):
        """What is published of each port: state and reason, and what the router is like."""
        state = json.loads(LAB.read("/run/tavo/tavoportforward.json"))
        self.assertEqual((state["protocol"], state["gateway"], state["box"]), ("pages", GATEWAY, BOX))
        return {row["name"]: (row["state"], row["why"] or "") for row in state["rules"]}, state

    def forwards(self):
        """The router's table without the other box's line, as single forwards."""
        return {(protocol, row["first"] + i): (row["host"], row["port"] + i) for row in LAB.web_state()["table"]
                for protocol in (("tcp", "udp") if row["protocol"] == "both" else (row["protocol"],))
                for i in range(row["last"] - row["first"] + 1)}

    def saved(self, wanted, *rules):
        answer = LAB.save(*rules)
        self.assertEqual((answer["result"], answer["status"], events()), (0, 0, ""))
        self.assertEqual(self.forwards(), {**wanted, **FOREIGN})
        self.assertEqual(LAB.mappings(), self.forwards())
        self.assertEqual(self.rows()[0], {f"{port}/{protocol}": ("open", "") for protocol, port in wanted})

    def test_saves_in_a_row(self):
        single = {("tcp", 5001): (BOX, 5001), ("udp", 5001): (BOX, 5001)}
        other = {("tcp", 5001): (BOX, 5002)}
        span = {("tcp", port): (BOX, port - 1000) for port in (6001, 6002, 6003)}
        table = (("form", False, [(single, "1,1,all,5001,5001"), ({**other, **span}, "1,1,tcp,5001,5002",
                                                                  "2,1,tcp,6001-6003,5001-5003", "3,0,tcp,7001,5001")]),
                 ("json", False, [(single, "1,1,all,5001,5001"), (other, "1,1,tcp,5001,5002")]),
                 ("blind", True, [(single, "1,1,all,5001,5001"), ({("udp", 5003): (BOX, 5003)}, "1,1,udp,5003,5003")]))
        for flavour, tls, saves in table:
            with self.subTest(flavour=flavour):
                self.forget()
                LAB.start_web(flavour, tls=tls)
                for wanted, *rules in saves + saves[-1:] + [({}, )]:
                    self.saved(wanted, *rules)
                    for probe in (("tcp", 5001), ("udp", 5001), ("tcp", 6002), ("udp", 5003)):
                        self.assertEqual(LAB.reaches(*probe), probe in wanted, probe)
                LAB.stop_router()

    def test_an_unchanged_set_is_only_looked_at(self):
        LAB.start_web("form")
        self.saved({("tcp", 5001): (BOX, 5001)}, "1,1,tcp,5001,5001")
        before = LAB.web_state()["count"]
        self.saved({("tcp", 5001): (BOX, 5001)}, "1,1,tcp,5001,5001")
        after = LAB.web_state()["count"]
        self.assertEqual((after["/forward.cgi"], after["/apply.cgi"]), (before["/forward.cgi"], before["/apply.cgi"]))

    def test_what_the_router_does_not_take(self):
        LAB.start_web("form")
        LAB.save("1,1,tcp,9999,5001", "2,1,tcp,5001,5001")
        self.assertEqual(self.forwards(), {("tcp", 5001): (BOX, 5001), **FOREIGN})
        self.assertIn("9999/tcp (another device has this port on the router)", events())
        self.assertEqual(self.rows()[0], {"9999/tcp": ("refused", "another device has this port on the router"),
                                          "5001/tcp": ("open", "")})
        self.assertIn({"address": LAN2, "description": "tavo:another box"}, [row["holder"] for row in self.rows()[1]["rules"]])
        LAB.save("1,1,tcp,5001,5001", "2,1,tcp,5001,5002")
        self.assertEqual([(row["box_port"], row["state"]) for row in self.rows()[1]["rules"]],
                         [(5001, "open"), (5002, "refused")], "of two rules for one port each has its own row")
        LAB.stop_router()
        LAB.start_web("blind")
        LAB.save("1,1,tcp,5001,5002", "2,1,tcp,9999,9999")
        self.assertEqual(self.forwards(), FOREIGN)
        self.assertIn("5001/tcp (the router cannot forward to another port number)", events())
        self.assertIn("9999/tcp (the router refused it)", events())
        LAB.save()
        self.assertEqual(self.forwards(), FOREIGN, "a refused forward is not taken for ours")

    def test_faults(self):
        """Fault: flavour, what the user learns, and a bound in seconds."""
        table = (("changed", "form", 'gave no "token"', 3), ("hangs", "form", "did not answer in time", 13),
                 ("hangs_on_add", "form", "did not answer in time", 13), ("endless", "blind", "too long", 5),
                 ("redirects", "blind", "answered with status 302", 3),
                 ("lies", "form", "said yes and does not keep it", 5), ("lies", "json", "said yes and", 5))
        for fault, flavour, why, seconds in table:
            with self.subTest(fault=fault, flavour=flavour):
                self.forget()
                LAB.start_web(flavour, fault)
                start = time.monotonic()
                self.assertEqual(LAB.save("1,1,tcp,5001,5001", seconds=seconds + 5)["result"], 0)
                self.assertLess(time.monotonic() - start, seconds)
                self.assertIn("ports: 5001/tcp (", events())
                self.assertNotIn("refused", events().split(" (")[0], "of a router that was not even reached")
                self.assertIn(why, events())
                rows, state = self.rows()
                known = {"hangs": ("unknown", "silent"), "hangs_on_add": ("unknown", "silent"), "endless": ("unknown", "ok")}
                self.assertEqual((rows["5001/tcp"][0], state["router"]), known.get(fault, ("refused", "ok")))
                self.assertIn(why, rows["5001/tcp"][1])
                self.assertGreater(len(LAB.web_state()["count"]), 1, "the fault was reached")
                self.assertEqual(self.forwards(), FOREIGN)
                LAB.stop_router()

    def test_an_expression_that_would_never_end(self):
        LAB.start_web("form")
        path = "/etc.defaults/portforward/routerdb/Alderman/Homestead 2/1.0/router.ops"
        LAB.write(path, LAB.read(path).replace("entry=", "entry=(?:[^!]+[^!]+)+!"))
        LAB.save("1,1,tcp,5001,5001", seconds=5)
        self.assertIn("cannot be searched", events())
        self.assertEqual(self.forwards(), FOREIGN)

    def test_wrong_password_is_tried_once(self):
        LAB.start_web("form")
        conf = LAB.read("/etc/portforward/router.conf")
        LAB.write("/etc/portforward/router.conf", conf.replace("p&ss", "wrong"))
        LAB.save("1,1,tcp,5001,5001", "2,1,tcp,5002,5002")
        self.assertIn("5001/tcp, 5002/tcp (the router does not accept the user name or the password)", events())
        self.assertEqual(LAB.web_state()["count"]["/login.cgi"], 1)
        self.assertNotIn("wrong=1", events())

    def test_values_stay_in_their_place(self):
        hostile = 'x&action=delete&id=1</td>"\\\\{pass}%0d%0a'
        for flavour in ("form", "json", "blind"):
            with self.subTest(flavour=flavour):
                self.forget()
                LAB.start_web(flavour)
                LAB.write("/etc/portforward/rule.conf", '[1]\nenabled="1"\nservice="' + hostile.replace('"', '\\"') +
                          '"\nprotocol name="tcp"\nr_port="5001"\ns_port="5001"\n')
                self.assertEqual(LAB.run("box", TOOL, check=False).returncode, 0)
                rows = [row for row in LAB.web_state()["table"] if row["host"] == BOX]
                self.assertEqual([row["name"] for row in rows], [("tavo:" + hostile.replace("\\\\", "\\"))[:31]])
                self.assertEqual(self.forwards(), {("tcp", 5001): (BOX, 5001), **FOREIGN})
                LAB.stop_router()

    def test_a_failed_removal_is_made_up_for(self):
        LAB.start_web("blind", "first_delete_fails")
        self.saved({("tcp", 5001): (BOX, 5001)}, "1,1,tcp,5001,5001")
        LAB.save("1,1,tcp,5001,5001")
        self.assertIn("removal of 5001/tcp (", events())
        self.assertEqual([row["name"] for row in self.rows()[1]["left_over"]], ["5001/tcp"])
        os.unlink(EVENTS)
        self.saved({})

    def test_what_cannot_be_taken_away_for_want_of_the_list_is_named(self):
        LAB.start_web("form")
        self.saved({("tcp", 5001): (BOX, 5001)}, "1,1,tcp,5001,5001")
        path = "/etc.defaults/portforward/routerdb/Alderman/Homestead 2/1.0/router.ops"
        LAB.write(path, LAB.read(path).replace("<h1>Port forwarding</h1>", "another title"))
        LAB.save()
        self.assertEqual([row["name"] for row in self.rows()[1]["left_over"]], ["5001/tcp"])

    def test_a_router_that_falls_silent_is_left_alone(self):
        LAB.start_web("form", "hangs_on_add")
        LAB.save(*(f"{port},1,tcp,{port},{port}" for port in range(5001, 5021)), seconds=25)
        self.assertIn("5020/tcp (the router has stopped answering)", events())

    def test_the_record_of_an_earlier_version_is_taken_over(self):
        for flavour in ("form", "blind"):
            with self.subTest(flavour=flavour):
                self.forget()
                LAB.start_web(flavour)
                self.saved({("udp", 5003): (BOX, 5003)}, "1,1,udp,5003,5003")
                os.unlink(RECORD)
                section = '[{}]\ngateway="{}"\nbox="{}"\nprotocol="udp"\nrouter_first="{}"\nrouter_last="{}"\nbox_first="5003"\nname="tavo:"\n'
                LAB.write(EARLIER, section.format(1, GATEWAY, BOX, 5003, 5003) + section.format(2, "10.9.9.9", BOX, 7000, 7005))
                self.saved({})
                self.assertFalse(os.path.exists(EARLIER))
                self.assertIn('gateway="10.9.9.9"', LAB.read(RECORD), "what another router has is not forgotten")
                LAB.write(EARLIER, "no sections\n")
                self.saved({})
                self.assertEqual(LAB.read(EARLIER.replace(".made", ".damaged")), "no sections\n")
                LAB.stop_router()

    def test_a_former_address_and_a_range_in_the_way(self):
        LAB.start_web("form")
        self.saved({("tcp", port): (BOX, port) for port in (6001, 6002, 6003)}, "1,1,tcp,6001-6003,6001-6003")
        former = "192.168.77.44"
        LAB.write(RECORD, LAB.read(RECORD).replace(f'client="{BOX}"', f'client="{former}"'))
        LAB.run("router", f"curl -s -X POST -d 'host={former}' http://127.0.0.1:8080/move")
        self.saved({("tcp", port): (BOX, port) for port in (6001, 6002)}, "1,1,tcp,6001-6002,6001-6002")
        LAB.save("1,1,tcp,9997-9999,5001-5003", "2,1,udp,9997-9999,5001-5003")
        why = "another entry of the router has one of its ports"
        self.assertEqual(self.rows()[0], {f"{port}/{protocol}": ("open", "") if protocol == "udp" else ("refused", why)
                                          for port in (9997, 9998, 9999) for protocol in ("tcp", "udp")})
        self.assertIn(f"9997-9999/tcp ({why})", events())
        self.assertIn({"address": LAN2, "description": "tavo:another box"}, [row["holder"] for row in self.rows()[1]["rules"]])

    def test_killed_in_the_middle_forgets_nothing(self):
        LAB.start_web("blind", "hangs_after_add")
        LAB.write("/etc/portforward/rule.conf",
                  '[1]\nenabled="1"\nprotocol name="tcp"\nr_port="5001"\ns_port="5001"\n')
        tool = LAB.start("box", TOOL)
        wait_for(lambda: ("tcp", 5001) in self.forwards(), 10, "the router has done it")
        tool.send_signal(signal.SIGKILL)
        tool.wait()
        self.saved({})

    # ---- the settings go over to another way ------------------------------------------------------------------

    def told(self, code, arguments):
        run = LAB.run("box", f"{BUILD}/cli/tavoportmap --json {arguments}", check=False)
        self.assertEqual(run.returncode, code, run.stdout)
        return json.loads(run.stdout)

    @staticmethod
    def names(answer):
        return [row["name"] for row in answer.get("left_over", [])]

    @staticmethod
    def forwarded():
        return [f"{row['first']}/{row['protocol']}" for row in LAB.web_state()["table"] if row["host"] == BOX]

    def clear(self):
        if self.web is None:
            return
        LAB.stop_daemon(signal.SIGKILL)
        LAB.clear_state(ACCOUNT, "/run/tavo/tavoportforward.json")
        LAB.stop_router()
        LAB.end(self.web)
        self.web = None

    def go_over(self, *rules, flavour="blind", settings=LAB_ONE):
        """The pages have these rules, and somebody has switched the router's UPnP on. What "router set" says of it."""
        self.clear()
        LAB.install()
        self.forget()
        LAB.start_web(flavour)
        self.web = LAB.router
        self.addCleanup(self.clear)
        LAB.save(*rules)
        self.made = LAB.read(RECORD)
        LAB.start_router()
        return self.told(0, f"router set {settings} --upnp yes")

    def test_what_the_pages_forward_goes_when_they_are_not_in_use_any_more(self):
        pages = f"router set {COBBLER} --upnp no"
        for trouble, again in ((False, ""), (True, "save"), (True, pages)):
            with self.subTest(trouble=trouble, again=again):
                warnings = self.go_over("1,1,tcp,5001,5001", "2,1,udp,5003,5003")["warnings"]
                self.assertIn("5001/tcp, 5003/udp", warnings[0])
                self.assertEqual(self.names(self.told(6, "status")), ["5001/tcp", "5003/udp"], "until the first save")
                good = LAB.read(ACCOUNT)
                if trouble:
                    LAB.write(ACCOUNT, good.replace("p&ss", "wrong"))
                    answer = self.told(4, "close 5003/udp")
                    self.assertEqual(self.names(answer), ["5001/tcp", "5003/udp"])
                    self.assertNotIn("5003/udp closed", answer["message"])
                    self.assertIn("does not accept the user name or the password", answer["message"])
                    self.assertEqual(self.names(self.told(4, "status")), ["5001/tcp", "5003/udp"])
                    self.assertTrue(LAB.reaches("udp", 5003))
                    kept = LAB.read(RECORD)
                    self.assertEqual(LAB.run("box", f"{TOOL} --forget").returncode, 0)
                    self.assertEqual(self.names(self.told(0, "status")), [], "taken away by hand, says the user")
                    LAB.write(RECORD, kept)
                    LAB.write(ACCOUNT, good)
                    self.told(0, again)
                    self.told(0, "save")
                else:
                    self.assertIn("5003/udp closed", self.told(0, "close 5003/udp")["message"])
                    LAB.write(RECORD, re.sub('hardware="[^"]+"', 'hardware="02:00:00:00:00:99"', self.made))
                    self.assertIn("the pages of another router that was at this address",
                                  "".join(self.told(0, "status")["warnings"]))
                    self.assertNotIn("left_over", self.told(0, "save"))
                    self.assertEqual((self.names(self.told(0, "status")), LAB.read(RECORD).count("00:99")), ([], 2))
                    LAB.write(RECORD, "")
                self.assertEqual(self.names(self.told(0, "status")), [])
                self.assertEqual(self.forwarded(), ["5001/tcp"] if again == pages else [])
                self.assertEqual(LAB.read(RECORD).count("router_port"), len(self.forwarded()))
                self.assertFalse(LAB.reaches("udp", 5003))
                if again != "save":  # the pages, as they go, clear the filter of the lab's other router, which does not notice
                    self.assertTrue(LAB.reaches("tcp", 5001))
                if again == pages:
                    self.assertIn("are in use", LAB.run("box", f"{TOOL} --forget", check=False).stderr)
                    self.assertEqual(LAB.run("box", f"{TOOL} --clear-unused").returncode, 0)
                    self.assertEqual(self.forwarded(), ["5001/tcp"], "who has waited for its turn looks once more")

    def test_a_save_that_ends_while_the_pages_clear_says_so(self):
        """By a signal, or since the rules cannot be written."""
        for cut in ("signal", "read-only"):
            with self.subTest(cut=cut):
                self.go_over("1,1,tcp,5001,5001")
                if cut == "signal":
                    clearing = f"{TOOL} --clear-unused"
                    os.kill(self.web.pid, signal.SIGSTOP)
                    run = LAB.start("box", f"{BUILD}/cli/tavoportmap", "--json", "close", "5001", stdout=-1, text=True,
                                    start_new_session=True)
                    wait_for(lambda: LAB.processes_of(clearing), 5, "the pages are asked")
                    os.killpg(run.pid, signal.SIGINT)  # as Ctrl-C does
                    told = run.communicate(timeout=20)[0]
                    os.kill(self.web.pid, signal.SIGCONT)
                    self.assertIn("ended before it stored a rule", told)
                    wait_for(lambda: not LAB.processes_of(clearing), 20, "the pages are done")
                    self.assertEqual(self.forwarded(), [])
                else:
                    for command in ("mount --bind {0} {0}", "mount -o remount,bind,ro {0}"):
                        os.system(command.format("/etc/portforward"))
                    told = LAB.run("box", f"{BUILD}/cli/tavoportmap --json save", check=False).stdout
                    os.system("umount /etc/portforward")
                    self.assertNotIn("Nothing was changed", told)
                    self.assertIn("is closed until a save succeeds", told)
                self.assertIn('enabled="1"', LAB.read("/etc/portforward/rule.conf"))

    def test_an_account_of_an_earlier_version_names_no_model(self):
        """The settings may name it still, or the user says it; and rules that cannot be read are in nobody's way."""
        for settings, named in ((f"{COBBLER} --max-rules 0", True), (LAB_ONE, False)):
            with self.subTest(settings=settings):
                self.go_over("1,1,tcp,5001,5001", settings=settings)
                LAB.write(ACCOUNT, re.sub("(?m)^(brand|model|version)=.*\n", "", LAB.read(ACCOUNT)))
                LAB.write("/etc/portforward/rule.conf", "no rules\n")
                if not named:
                    answer = self.told(1, "off")
                    self.assertEqual((self.names(answer), self.forwarded()), (["5001/tcp"], ["5001/tcp"]))
                    self.assertRegex(answer["message"], "router set' with --upnp no and the --brand.*with --upnp yes goes back")
                    self.told(0, f"router set {COBBLER} --upnp no")
                    self.told(0, f"router set {LAB_ONE} --upnp yes")
                self.assertIn("have taken away what they still forwarded: 5001/tcp", self.told(1, "off")["message"])
                self.assertEqual((self.forwarded(), self.names(self.told(1, "status"))), ([], []))

    def test_what_upnpd_has_made_is_left_where_the_pages_list_it(self):
        self.go_over("1,1,udp,5003,5003", flavour="form")
        self.told(0, "open 5001")
        LAB.write(RECORD, self.made)
        for protocol, port in (("udp", 5003), ("tcp", 5001)):
            row = {"name": "tavo:x", "protocol": protocol, "first": port, "last": port, "host": BOX, "port": port}
            LAB.run("router", "curl -s -X POST --data-binary @- http://127.0.0.1:8080/upnp", input=json.dumps(row))
        self.assertEqual(self.forwarded(), ["5003/udp", "5001/tcp"])
        self.assertEqual(LAB.run("box", f"{TOOL} --clear-unused").returncode, 0)
        self.assertEqual(self.forwarded(), ["5001/tcp"])

    def test_who_saves_through_the_library_alone_has_the_pages_cleared(self):
        """By the daemon, beside it; and not again and again where they refuse."""
        self.go_over("1,1,tcp,5001,5001", "2,1,udp,5003,5003")
        LAB.save("1,1,tcp,5001,5001")
        wait_for(lambda: self.forwarded() == [], 20, "the pages have taken it away")
        self.assertEqual(self.names(self.told(0, "status")), [])
        self.go_over("1,1,tcp,5001,5001")
        good = LAB.read(ACCOUNT)
        LAB.write(ACCOUNT, good.replace("p&ss", "wrong"))
        asked = lambda: LAB.web_state()["count"].get("/delete", 0)
        before = asked()
        for save in (lambda: LAB.save("1,1,tcp,5002,5002"), lambda: LAB.save("1,1,tcp,5001,5001")):
            save()
            wait_for(lambda: asked() > before, 20, "the pages are asked")
        time.sleep(1)
        self.assertEqual(asked(), before + 1)
        self.told(4, "save")
        time.sleep(1)
        self.assertEqual(asked(), before + 2, "the tool asks each time, and nobody after it")

    def test_what_is_gone_by_the_pages_word_may_be_there_still(self):
        """A change that was not applied, and one more: what is in force has another port of the box than both."""
        LAB.start_web("blind", "applies_once")
        place = "/etc.defaults/portforward/routerdb/Cobbler/Gate/1/router."
        LAB.write(place + "ops", LAB.read(place + "ops").replace("delete?", "delete?port={box_first}&") +
                  '[apply]\npath="/apply"\nexpect text="OK"\n')
        LAB.write(place + "des", LAB.read(place + "des").replace("[PF port page]\n", '[PF port page]\nchange router port="yes"\n'))
        self.saved({("tcp", 5001): (BOX, 5001)}, "1,1,tcp,5001,5001")
        for port in (5002, 5003):
            LAB.save(f"1,1,tcp,5001,{port}")
            self.assertEqual(self.forwards(), {("tcp", 5001): (BOX, 5001), **FOREIGN})
        os.unlink(EVENTS)
        self.saved({})


class Database(unittest.TestCase):
    def test_operations_that_cannot_be_performed(self):
        good = "[PF add port]\npath=/a\n[PF delete port]\npath=/d\n"
        table = (("[login]\nform=x\n" + good, "[login] has no path"), (good + "sleep=1\n", '"sleep" of [PF delete port]'),
                 ("[global]\nsyntax version=2\n" + good, '"syntax version" of [global]'),
                 ("[PF add port]\npath=/a\n", "[PF delete port] is missing"), (good + "[PF lst]\npath=/l\n", "[PF lst]"),
                 (good + "path=http://192.168.77.3/\n", '"path" of'), (good + "take x=([0-9\n", '"take x" of'),
                 (good + "header X: y=z\n", '"header X: y" of'), ("no sections\n", "no sectioned file"),
                 (good + "take x=groupless\n", '"take x" of'), (good + "form={id}\n", "{id} in [PF delete port]"),
                 ("[login]\npath=/{token}\n" + good + "take token=(x)\n", "{token} in [login]"),
                 (good + "[PF list]\npath=/\nentry=(?<router_first>.)\n", '"entry" of'))
        descriptions = (("[PF port page]\ntcp=\n", "no \"max rule\""), ("[PF port page]\nmax rule=0\n", '"max rule" of'),
                        ("[PF prot page]\nmax rule=1\n", "[PF prot page] is no section"),
                        ("[PF range page]\nmax rule=1\ntpc=1\n", '"tpc" of'), ("[global]\n", "[PF port page] is missing"))
        for kind, rows in (("ops", table), ("des", descriptions)):
            for text, why in rows:
                with self.subTest(text=text):
                    LAB.write(f"/tmp/router.{kind}", text)
                    out = LAB.run("box", f"{TOOL} --check /tmp/router.{kind}", check=False)
                    self.assertEqual((out.returncode, why in out.stdout), (1, True), out.stdout)
        samples = f"find {HERE}/../../packaging/routerdb -name 'router.*' -exec {TOOL} --check {{}} +"
        self.assertEqual(LAB.run("box", samples).stdout, "")


def prepare(lab):
    global LAB
    LAB = lab
    lab.serve(5001, 5002, 5003)


if __name__ == "__main__":
    run_tests(prepare)
