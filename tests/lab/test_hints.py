"""Walks the hints: what the tool recommends is done there and then, in every state that it can be in, and leads on.

A hint is a command of the tool in quotes, or on a line of its own. One that comes after "then" is done after what the
sentence asks for before it. A hint leads on when it succeeds, or fails with other words, which are walked in their turn;
words that come back on the same way are a circle. No hint may be wrong usage.
"""
import fcntl
import os
import re
import shutil
import signal
import unittest

import homelab
import networks
from homelab import GATEWAY, LAN2, TOOL, sh, wait_for

LAB = OUTSIDE = None
CONF = "/etc/portforward"
OK, USAGE, AWAY = 0, 2, 6
# What a hint leaves for the user to fill in; the model is the one that is described in the lab.
WORDS = {"BRAND": "Alderman", "MODEL": "'Homestead 2'", "VERSION": "1.0", "NAME": "admin", "NUMBER": "32", "PORT": "8443",
         "ID": "1"}
QUOTED = re.compile(r"(\bthen (?:run )?)?'(?:sudo )?tavoportmap\s+([^']*)'")
LINE = re.compile(r"^[ ]+(?:- )?(?:sudo )?tavoportmap (.+?)(?:  .*)?$", re.M)
OTHER = re.compile(r"'(?:sudo )?((?:ip|journalctl|df|systemctl) [^']*)'")
# Commands that only look: what comes after them stands where it stood before.
LOOKS = re.compile(r"(?:status|rules list|router show|router table|service plan|test|detect(?!.* --save))\b")


def hints(text):
    """(command, whether something else is to be done before it), in the order of the text."""
    text = re.sub(r"\\\n\s*", "", text)
    found = [(m.start(), m[2], bool(m[1])) for m in QUOTED.finditer(text)]
    found += [(m.start(), m[1], False) for m in LINE.finditer(text)]
    unique = {}
    for _, command, later in sorted(found):
        unique.setdefault(re.sub(r"\b[A-Z]+\b", lambda m: WORDS.get(m[0], m[0]), command.strip()), later)
    return list(unique.items())


def run(command):
    """Exit code and words; a password that a command asks for at a terminal is given on standard input."""
    asks = "--user" in command
    done = LAB.run("box", f"{TOOL} {command}{' --password-file -' if asks else ''}", check=False, timeout=120,
                   input="secret\n" if asks else "")
    return done.returncode, done.stdout + done.stderr


def words_of(text):
    """What makes a message the same as another one: no progress, no numbers that count up."""
    return re.sub(r"(?m)^ *\d+ % .*$", "", text).strip()


class Hints(unittest.TestCase):
    """Each case is a state: how it comes about, how a user ends it (for what comes "then"), and what he may type."""

    def setUp(self):
        self.told = {}
        self.live = None  # the commands that made the network and the box what they are now
        self.walked = []
        self.keep = []

    def tearDown(self):
        self.clear()

    def clear(self):
        for undo in reversed(self.keep):
            undo()
        self.keep = []
        LAB.stop_daemon(signal.SIGKILL)
        LAB.stop_router()
        LAB.clear_state("/etc/tavoinfo.conf", "/var/lib/tavo/run_keys.conf", *(f"{CONF}/{name}" for name in os.listdir(CONF)))
        shutil.rmtree("/etc.defaults/portforward/routerdb", ignore_errors=True)
        LAB.install()
        OUTSIDE.settings()
        os.unlink(f"{CONF}/router.conf")
        LAB.write(f"{CONF}/router_upnp.db", "")

    def do(self, command, arrange, remedy=None, before=()):
        """The command after those that led to it, in a fresh state if another one is there; each way is gone once."""
        key = (before, command, remedy is not None)
        if key not in self.told:
            if self.live != before:
                self.clear()
                arrange()
                for step in before:
                    run(step)
            if remedy:
                remedy()
            self.told[key] = code, _ = run(command)
            self.live = None if remedy else before + self.led([(command, code, "")])
        return self.told[key]

    @staticmethod
    def led(way):
        """The commands that made the state what it is: those that did more than look, also for a router that is away."""
        return tuple(step for step, code, _ in way if code in (OK, AWAY) and not LOOKS.match(step))

    def walk(self, command, arrange, remedy, path=()):
        code, text = self.do(command, arrange, None, self.led(path))
        words = words_of(text)
        way = [*path, (command, code, words)]
        before = self.led(way)
        shown = "\n".join(f"--- {step} -> {status}\n{said}" for step, status, said in way)
        self.assertFalse(path and code == USAGE, f"a hint that is no command:\n{shown}")
        self.assertNotIn(words, [said for _, _, said in path], f"a circle:\n{shown}")
        self.assertNotRegex(words, r"\b(?:delete|remove|unlink)\b[^.]* /(?:etc|tmp|var)", shown)
        for other in OTHER.findall(text):
            self.assertTrue(shutil.which(other.split()[0]) or other.startswith(("journalctl", "systemctl")), shown)
        self.walked.append(command)
        for hint, later in hints(text):
            if hint == "test --help" or "--help" in hint:
                self.assertEqual(run(hint)[0], OK, shown)
            elif later:
                self.assertIsNotNone(remedy, f"nothing can be done before {hint!r}:\n{shown}")
                after, said = self.do(hint, arrange, remedy, before)
                self.assertTrue(after == OK or words_of(said) not in [w for _, _, w in way],
                                f"{hint!r} leads back even after what it asks for:\n{shown}\n--- {hint}\n{said}")
            elif code != OK or not path:
                self.walk(hint, arrange, remedy, tuple(way))
            else:
                self.assertNotEqual(self.do(hint, arrange, None, before)[0], USAGE, shown)

    def expect(self, arrange, commands, remedy=None, least=1):
        """least: so many hints are met, so that a state without any is not taken for one whose hints are good."""
        for command in commands:
            self.walk(command, arrange, remedy)
        self.assertGreaterEqual(len(self.walked) - len(commands), least, self.walked)

    # ---- networks ---------------------------------------------------------------------------------

    def test_no_gateway(self):
        def arrange():
            LAB.start_router()
            sh("ip -n box route del default")
            self.keep.append(back)
        def back():
            sh(f"ip -n box route replace default via {GATEWAY}", check=False)
        self.expect(arrange, ("setup --yes", "detect", "save", "router show", "compat", "open 443"), back, 0)

    def test_cable_out(self):
        def arrange():
            LAB.start_router()
            sh("ip -n router link set box1 down")
            self.keep.append(back)
        def back():
            sh("ip -n router link set box1 up")
            wait_for(lambda: "LOWER_UP" in sh("ip -n box link show box0").stdout, 10, "the cable is in")
        self.expect(arrange, ("setup --yes", "detect", "status", "save"), back)

    def test_no_internet(self):
        def arrange():
            LAB.start_router()
            sh("ip -n router link set wan0 down")
            self.keep.append(back)
        def back():
            sh("ip -n router link set wan0 up")
        self.expect(arrange, ("setup --yes", "detect"), back, 0)

    # ---- routers ----------------------------------------------------------------------------------

    def test_router_of_an_unknown_model(self):
        self.expect(LAB.start_router, ("setup", "detect", "detect --save", "save", "router show", "status", "rules list",
                                       "service plan hoplink 80/tcp", "report", "test"), None, 5)

    def test_router_that_fails_the_test(self):
        def newer():
            LAB.end(LAB.router)
            LAB.start_router()
        self.expect(lambda: LAB.start_scripted("keeps_nothing"), ("setup --yes", "compat", "save"), newer, 3)

    def test_router_that_the_database_does_not_trust(self):
        def arrange():
            LAB.start_scripted("none")
            LAB.write(f"{CONF}/router_upnp.db", '[Lab/Scripted/7]\nsupport="no"\nmax="9"\n')
        self.expect(arrange, ("setup", "detect --save"), None, 2)

    def test_router_that_speaks_natpmp_only(self):
        self.expect(lambda: LAB.start_router(upnp=False), ("setup", "detect", "compat", "save"), None, 2)

    def test_router_with_everything_switched_off(self):
        def described():
            shutil.copytree(f"{homelab.HERE}/../../packaging/routerdb", "/etc.defaults/portforward/routerdb",
                            dirs_exist_ok=True)
        self.expect(described, ("setup", "detect", "compat"), LAB.start_router, 2)

    def test_router_that_is_silent_after_it_was_known(self):
        def arrange():
            LAB.router_conf(False)
            LAB.write(f"{CONF}/router_upnp.db", '[Lab/One/1]\nsupport="yes"\nmax="100"\n')
            LAB.write(f"{CONF}/rule.conf", '[1]\nenabled="1"\nprotocol name="tcp"\nr_port="5001"\ns_port="5001"\n')
        self.expect(arrange, ("setup", "status"), LAB.start_router, 0)

    def test_router_that_is_driven_through_its_pages(self):
        def switched_on():
            LAB.end(LAB.router)
            LAB.start_router()
        self.expect(lambda: LAB.start_web("form"), ("setup", "detect", "status", "save", "service plan hoplink 80/tcp"),
                    switched_on, 1)

    def test_router_whose_pages_nobody_describes(self):
        def arrange():
            LAB.start_web("form")
            shutil.rmtree("/etc.defaults/portforward/routerdb")
        self.expect(arrange, ("setup", "save"), LAB.start_router, 1)

    def test_router_that_is_full(self):
        def arrange():
            LAB.start_router()
            LAB.write(f"{CONF}/router.conf", f'[{GATEWAY}]\nbrand="Lab"\nmodel="One"\nversion="1"\n'
                      'support_router_upnp="yes"\nsupport_router_natpmp="no"\n')
            LAB.write(f"{CONF}/router_upnp.db", '[Lab/One/1]\nsupport="yes"\nmax="1"\n')
            LAB.write(f"{CONF}/rule.conf", "".join(
                f'[{i}]\nenabled="1"\nprotocol name="tcp"\nr_port="{5000 + i}"\ns_port="5001"\n' for i in (1, 2)))
        self.expect(arrange, ("save", "open 443"), None, 0)

    # ---- settings ---------------------------------------------------------------------------------

    def test_settings_of_another_router(self):
        def arrange():
            LAB.start_router()
            LAB.write(f"{CONF}/router.conf", f'[{LAN2}]\nbrand="Lab"\nmodel="One"\nversion="1"\n'
                      'support_router_upnp="yes"\nsupport_router_natpmp="no"\n')
        self.expect(arrange, ("save", "router show", "status"), None, 2)

    def test_settings_that_nobody_can_read(self):
        def arrange():
            LAB.start_router()
            LAB.write(f"{CONF}/router.conf", "\0no settings\n")
        self.expect(arrange, ("router show", "router set --upnp yes --brand X", "setup --yes", "save"), None, 2)

    def test_settings_without_a_number_of_rules(self):
        def arrange():
            LAB.start_router()
            LAB.router_conf(False)
        self.expect(arrange, ("save", "router show", "service plan hoplink 80/tcp"), None, 2)

    # ---- the box ------------------------------------------------------------------------------------

    def test_edits_that_are_not_saved(self):
        def arrange():
            LAB.start_router()
            run("setup --yes")
            run("rules add web --router-port 443 --box-port 8443")
        self.expect(arrange, ("status", "rules list", "rules remove 7"), None, 1)

    def test_daemon_that_was_killed(self):
        def arrange():
            LAB.start_router()
            run("setup --yes")
            run("rules add web --router-port 443 --box-port 8443")
            run("save")
            LAB.stop_daemon(signal.SIGKILL)
        self.expect(arrange, ("status", "rules list"), None, 0)

    def test_another_operation(self):
        def arrange():
            LAB.start_router()
            LAB.router_conf(False)
            lock = open("/tmp/routerconf.lock", "w", encoding="utf-8")  # pylint: disable=consider-using-with
            fcntl.flock(lock, fcntl.LOCK_EX)
            self.keep.append(lock.close)
        self.expect(arrange, ("setup", "detect", "save", "compat", "router show"), None, 0)

    # ---- the promise --------------------------------------------------------------------------------

    def test_from_an_empty_machine_to_an_open_port_and_back(self):
        LAB.start_router()
        LAB.serve(8443)
        self.clear()
        LAB.start_router()
        code, said = run("setup --yes")
        self.assertEqual(code, OK, said)
        self.assertRegex(said, "(?s)driven by +UPnP.*outside +198.41.0.4.*8443 +python3")
        self.assertFalse(LAB.reaches("tcp", 443))
        code, said = run("open 443 --to 8443")
        self.assertEqual(code, OK, said)
        self.assertTrue(LAB.reaches("tcp", 443))
        code, said = run("close 443")
        self.assertEqual(code, OK, said)
        self.assertFalse(LAB.reaches("tcp", 443))
        self.assertEqual(LAB.mappings(), {})
        self.clear()
        LAB.start_router()
        code, said = run("open 443 --to 8443 --yes")  # the one command, from nothing
        self.assertEqual(code, OK, said)
        self.assertTrue(LAB.reaches("tcp", 443))


class Rule(unittest.TestCase):
    """The walk itself sees circles, wrong commands and what comes later."""

    def test_extraction(self):
        self.assertEqual(hints("see to it, then run 'tavoportmap setup'; 'tavoportmap compat' tests.\n"
                               "  tavoportmap router set --brand BRAND \\\n      --upnp no    says it\n  - tavoportmap status\n"),
                         [("setup", True), ("compat", False), ("router set --brand Alderman --upnp no", False),
                          ("status", False)])

    def test_the_walk_sees_what_is_wrong(self):
        for told, wrong in (({"a": (1, "try 'tavoportmap b'"), "b": (1, "try 'tavoportmap a'")}, "a circle"),
                            ({"a": (1, "try 'tavoportmap b'"), "b": (2, "there is no command 'b'")}, "no command"),
                            ({"a": (1, "plug it in, then 'tavoportmap a'")}, "leads back"),
                            ({"a": (1, "try 'tavoportmap b'"), "b": (0, "done")}, None)):
            walker = Hints()
            walker.setUp()
            walker.do = lambda command, arrange, remedy=None, before=(), told=told: told[command]
            if wrong:
                self.assertRaisesRegex(AssertionError, wrong, walker.walk, "a", None, lambda: None)
            else:
                walker.walk("a", None, None)


def prepare(lab):
    global OUTSIDE
    OUTSIDE = networks.Outside(lab, avahi=False)


if __name__ == "__main__":
    homelab.run_tests(prepare)
