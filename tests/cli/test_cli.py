"""The command-line tool as a person or a script meets it: arguments in, exit code and text or JSON out.

Runs inside tests/sandbox, with a gateway that answers nobody. What only a router could answer comes from
stand_in.cpp, preloaded.
"""
import contextlib
import fcntl
import itertools
import json
import os
import pty
import random
import re
import shutil
import signal
import socket
import subprocess
import termios
import time
import unittest

BUILD = os.environ["TAVO_BUILD_DIR"]
SOURCE = os.environ["TAVO_SOURCE_DIR"]
TOOL = f"{BUILD}/cli/tavoportmap"
NETCHECK = f"{BUILD}/platform/linux/tavo-netcheck"
STAND_IN = f"{BUILD}/tests/cli/libstand_in.so"
CONF = "/etc/portforward"
RULES, ROUTER, DATABASE = f"{CONF}/rule.conf", f"{CONF}/router.conf", f"{CONF}/router_upnp.db"
DRAFT, OFF = f"{CONF}/rule.conf.draft", f"{CONF}/rules.off"
MODELS = "/etc.defaults/portforward/routerdb"
GATEWAY = "192.168.77.1"
OK, FAILED, USAGE, BUSY, REFUSED, TOO_MANY, AWAY = range(7)
KNOWN = f"""[{GATEWAY}]
brand="Acme"
model="R1"
version="1"
support_router_upnp="%s"
support_router_natpmp="%s"
"""
WRITES = {"LD_PRELOAD": STAND_IN, "TAVO_SAVE": "0 0 write"}


def tool(*arguments, stdin="", **environment):
    run = subprocess.run([TOOL, *arguments], input=stdin, text=True, capture_output=True, timeout=60,
                         env={**os.environ, **environment})
    return run.returncode, run.stdout, run.stderr


def put(path, text):
    os.makedirs(os.path.dirname(path), exist_ok=True)
    with open(path, "w", encoding="utf-8") as file:
        file.write(text)


def get(path):
    with open(path, encoding="utf-8") as file:
        return file.read()


def program(path, lines):
    put(path, f"#!/bin/sh\n{lines}\n")
    os.chmod(path, 0o755)


def known(upnp="yes", natpmp="no", brand="Acme", most=None):
    """The settings of the router, and how many rules it holds."""
    put(ROUTER, KNOWN.replace("Acme", brand) % (upnp, natpmp))
    if most is not None:
        put(DATABASE, f'[{brand}/R1/1]\nsupport="yes"\nmax="{most}"\n')


@contextlib.contextmanager
def held(path="/tmp/routerconf.lock"):
    with open(path, "w", encoding="utf-8") as lock:
        fcntl.flock(lock, fcntl.LOCK_EX)
        yield


@contextlib.contextmanager
def no_gateway():
    subprocess.run(["ip", "route", "del", "default"], check=True)
    try:
        yield
    finally:
        subprocess.run(["ip", "route", "add", "default", "via", GATEWAY], check=True)


def describe(brand, model, version):
    put(f"{MODELS}/{brand}/{model}/{version}/router.des",
        '[global]\nsyntax version="1"\n[PF port page]\ntcp="yes"\nudp="yes"\nchange router port="yes"\nmax rule="4"\n')


def on_terminal(*arguments, typed=b"", **environment):
    """Exit code and everything that a terminal would have got."""
    pid, fd = pty.fork()
    if pid == 0:
        os.execve(TOOL, [TOOL, *arguments], {**os.environ, "TERM": "xterm", **environment})
    os.write(fd, typed)
    text = b""
    try:
        while chunk := os.read(fd, 4096):
            text += chunk
    except OSError:  # the other side is closed
        pass
    os.close(fd)
    return os.waitstatus_to_exitcode(os.waitpid(pid, 0)[1]), text.decode()


def bound(keep, address, port, kind=socket.SOCK_STREAM, peer=None):
    """A socket that lasts as long as others are kept, and listens where it is connected to nobody."""
    made = keep.enter_context(socket.socket(socket.AF_INET6 if ":" in address else socket.AF_INET, kind))
    made.bind((address, port))
    if peer:
        made.connect(peer)
    elif kind == socket.SOCK_STREAM:
        made.listen()


class Tool(unittest.TestCase):
    def setUp(self):
        shutil.rmtree(MODELS, ignore_errors=True)
        for path in (RULES, DRAFT, OFF, ROUTER, f"{DATABASE}.user", f"{CONF}/router_detect.cache"):
            with contextlib.suppress(FileNotFoundError):
                os.unlink(path)
        put(DATABASE, '[Acme/R1/1]\nsupport="yes"\nmax="1"\n')

    def json(self, *arguments, **environment):
        """One document on standard output, nothing beside it, and ok exactly with exit code 0."""
        code, out, err = tool("--json", *arguments, **environment)
        self.assertEqual(err, "")
        answer = json.loads(out)
        self.assertEqual(answer["ok"], code == OK)
        return code, answer

    def expect(self, arguments, code, pattern, **environment):
        got, out, err = tool(*arguments.split(), **environment)
        with self.subTest(arguments=arguments, **environment):
            self.assertEqual(got, code, out + err)
            self.assertRegex(out + err, pattern)
            self.assertNotIn("\x1b", out + err)

    def rows(self):
        return [(rule["id"], rule["enabled"], rule["protocol"], rule["router_ports"], rule["box_ports"], rule["name"])
                for rule in self.json("rules", "list")[1]["rules"]]

    def saved(self):
        """The edits come into force as by a save that goes well."""
        known(most=100)
        self.expect("save", OK, "in force|no rule is switched on", **WRITES)

    def test_a_hint_names_sudo_where_root_is_needed(self):
        """In the texts of the sources, wherever a text is broken into lines."""
        roots = r"(setup|open|close|off|on|save|detect|compat|report|test|service|rules|router (set|show)|routers --update|{})"
        folder = f"{SOURCE}/cli"
        for name in sorted(os.listdir(folder)):
            lines = [line for line in get(f"{folder}/{name}").split("\n") if not line.lstrip().startswith("//")]
            text = re.sub(r'"\s*\n\s*"', "", "\n".join(lines))
            for wrong in re.findall(rf"(?<!sudo )\btavoportmap {roots}(?![\w-])(?! --help| set --help|{{}}--help)", text):
                self.fail(f"{name}: 'tavoportmap {wrong[0]}' without sudo")
            self.assertNotIn("sudo sudo", text, name)

    # ---- arguments ------------------------------------------------------------------------------

    def test_wrong_arguments_are_answered_with_the_right_ones(self):
        for arguments, nearest, pattern in (
                ("", None, "(?s)Usage.*needs a command: .*save"),
                ("rules", None, "(?s)Usage: tavoportmap rules.*needs a command: list, add"),
                ("rulse", "rules", "did you mean 'rules'"),
                ("rules lsit", "list", "did you mean 'list'.*\n.*list, add, remove, enable, disable"),
                ("rules enabl 1", "enable", "did you mean 'enable'"),
                ("help", "--help", "did you mean '--help'"),
                ("version", "--version", "did you mean '--version'"),
                ("xyzzy", None, "there is no command 'xyzzy'\n"),
                ("rules add --nmae x", "--name", "no option '--nmae' for 'rules add'; did you mean '--name'"),
                ("save --jsno", "--json", "did you mean '--json'"),
                ("router set --password x", "--password-file", "no option '--password'.*\n.*--password-file"),
                ("rules add", None, "--router-port is required"),
                ("rules remove", None, "rule is required"),
                ("save now", None, "'now' is one word too many for 'save'"),
                ("rules add --router-port 1 --protocol tpc", None, "none of tcp, udp, all; did you mean 'tcp'"),
                ("router set --conn-port 70000", None, "'70000' is no whole number from 1 to 65535"),
                ("router set", None, "nothing to set; for example"),
                ("rules add --router-port 0", None, "'0' is no port list: write ports from 1 to 65535"),
                ("rules add --router-port 1-3 --box-port 1", None, "3 router ports but 1 box ports"),
                ("rules remove 4", None, "there is no rule 4; none is stored")):
            self.expect(arguments, USAGE, pattern)
            code, answer = self.json(*arguments.split())
            self.assertEqual((code, answer.get("did_you_mean")), (USAGE, nearest), arguments)

    def test_help_and_man_page_know_every_command_and_option(self):
        page = get(f"{SOURCE}/docs/tavoportmap.1").replace("\\-", "-")
        for command in ("", "setup", "detect", "router show", "router set", "router table", "routers", "rules list", "rules add", "rules remove",
                        "rules enable", "rules disable", "rules edit", "rules discard", "rules import", "rules export",
                        "open", "close", "off", "on", "save", "status", "compat", "test", "report", "diag", "diag parse-ports",
                        "diag to-ports", "diag rules", "diag used-ports", "diag conflicts", "diag test", "diag set",
                        "service", "service set", "service plan", "service clear", "service list", "service detect"):
            code, out, err = tool(*command.split(), "--help")
            self.assertEqual((code, err), (OK, ""), command)
            self.assertIn(command, page)
            for option in re.findall(r"--[a-z-]+", out):
                self.assertIn(option, page, f"{option} of '{command}'")
        self.assertIn("Usage", self.json("rules", "--help")[1]["help"])

    # ---- rules ----------------------------------------------------------------------------------

    def test_rules_round_trip(self):
        self.expect("rules list", OK, "no rules are stored yet; 'sudo tavoportmap open 443' (?s:.)*rules add web")
        self.expect("rules add web --router-port 443 --box-port 8443", OK, "rule 1 noted, not in force yet")
        self.expect("rules add --name dns --protocol all --router-port 53,5000-5001 --disabled", OK, "rule 2 noted")
        self.expect("rules add --router-port 443", USAGE, "rule 1 already forwards router port 443/tcp")
        self.expect("rules add --router-port 443 --protocol udp", OK, "rule 3 noted")
        self.expect("rules add --router-port 400-500 --force", OK, "rule 4 noted(?s:.)*rules 1 and 4 both want")
        self.expect("rules disable 4", OK, "noted")
        self.expect("rules enable 4", USAGE, "rule 1 already forwards router port 443/tcp")
        self.expect("rules enable dns", OK, "noted")
        for which, code, pattern in (("3", OK, "noted"), ("3", USAGE, "there is no rule 3; the rules are 1, 2, 4"),
                                     ("450", USAGE, "rule 4 forwards more than '450'(?s:.)*tavoportmap close 450"),
                                     ("http", USAGE, "there is no rule http")):
            self.expect(f"rules remove {which}", code, pattern)
        for ports in ("80\n", "80,\v81"):  # no daemon takes it
            self.assertEqual(tool("rules", "add", "--router-port", ports)[0], USAGE)
        self.assertEqual(self.rows(), [("1", True, "tcp", "443", "8443", "web"),
                                       ("2", True, "all", "53,5000-5001", "53,5000-5001", "dns"),
                                       ("4", False, "tcp", "400-500", "400-500", "")])

    def test_a_change_touches_nothing_else(self):
        long_name = "n" * 1500
        put(RULES, f'[2147483647]\nenabled="1"\nprotocol name="tcp"\nr_port="80"\ns_port="80"\nservice="{long_name}"\n'
                   '[relay]\nenabled="0"\nprotocol name="udp"\nr_port="81"\ns_port="82"\nservice_id="HopLink"\n')
        before = self.json("rules", "list")[1]["rules"]
        self.expect("rules add --router-port 90", OK, "rule 1 noted")
        self.expect("rules disable 1", OK, "noted")
        self.assertEqual(self.json("rules", "list")[1]["rules"][:2], before)
        self.assertEqual([rule["name"] for rule in before], [long_name, ""])
        self.expect("save", FAILED, "longer than 1023 bytes and would be cut", LD_PRELOAD=STAND_IN, TAVO_SAVE="0 0")

    def test_no_port_comes_of_a_list_that_is_cut(self):
        """What is a byte too long for the library's records, or would be after a merge, is refused beforehand."""
        known(brand="Zeta", most=0)
        world = {"LD_PRELOAD": STAND_IN, "TAVO_USED": "TCP:9", "TAVO_SAVE": "0 write"}
        listed = lambda *ends: ",".join(map(str, [*range(1001, 1408, 2), *ends]))
        self.assertEqual([len(listed()), len(listed(443))], [1019, 1023])
        for ports, plan, code in ((listed(44), "rule 7 .web. would get longer.*when the service asks by itself", USAGE),
                                  (listed(443), "a port list of rule 7 is longer than 1022 bytes and would be cut", FAILED),
                                  (listed(4433), "a port list of rule 7 is longer than 1022 bytes and would be cut", FAILED)):
            self.store((1, "tcp", ports, ports, "web"))
            before = get(RULES)
            self.expect("service plan hoplink 80/tcp", OK if code == USAGE else FAILED, plan, **world)
            self.expect("service set hoplink 80/tcp --force", code, plan, **world)
            self.assertEqual(self.rows()[0][3], ports, "the tool still shows it whole")
            self.expect("rules add --router-port 90", OK, "noted")
            self.expect("save", OK if code == USAGE else FAILED, "in force" if code == USAGE else "1022 bytes", **WRITES)
            if code == FAILED:
                self.assertEqual(get(RULES), before)
                self.expect("rules remove 7", OK, "noted")
                self.expect("save", OK, "in force", **WRITES)
            self.assertEqual(tool("rules", "discard")[0], OK)
        self.assertEqual(tool("rules", "add", "--router-port", listed(443))[0], USAGE)
        self.assertIn("1022 is the most", tool("rules", "add", "--router-port", listed(443))[2])

    def test_an_unreadable_file_is_left_alone(self):
        for text in ("\0\1 no rules\n", '[1]\nenabled="1"\n'):
            put(RULES, text)
            for arguments in ("rules add --router-port 80", "rules list", "rules remove 1", "save"):
                self.expect(arguments, FAILED, "cannot be read as rules; it was left as it is")
            self.assertEqual(get(RULES), text)
            self.expect("status", FAILED, "rules +unreadable")

    def test_hostile_texts_do_not_reach_the_terminal(self):
        name = "\x1b[2Jx\r\n\u202eevil\u009b31m\x7f"
        self.assertEqual(tool("rules", "add", name, "--router-port", "80")[0], OK)
        self.assertEqual(self.rows()[0][5], name)
        known(brand=r"\x1b]0;owned\x07")
        for arguments in (("rules", "list"), ("rules", name), ("rules", "remove", name + "x"), ("status",), ("router", "show"),
                          ("rules", "add", "--router-port", name)):
            code, text = on_terminal(*arguments, NO_COLOR="1")
            self.assertFalse(set("\x1b\x07\x7f\u009b\u202e") & set(text), (arguments, text))
        self.assertIn(r"\x1b[2Jx\x0d\x0a\u{202e}evil\u{9b}31m\x7f", tool("rules", "list")[1])

    def test_only_a_terminal_gets_colours(self):
        tool("rules", "add", "--router-port", "80")
        for environment, coloured in (({}, True), ({"NO_COLOR": "1"}, False), ({"TERM": "dumb"}, False)):
            self.assertEqual("\x1b[1m" in on_terminal("rules", "list", **environment)[1], coloured, environment)

    def test_no_line_is_wider_than_its_terminal_and_no_word_is_lost(self):
        model = "Homestead \u4e2d\u6587 2 with a long name that goes on"
        name = "a name longer than a narrow terminal is wide, and some"
        describe("Alderman", model, "1.0")
        tool("rules", "add", name, "--router-port", "80,443,8000-8010")
        tool("rules", "add", "web", "--router-port", "443", "--box-port", "8443", "--force")
        self.saved()
        world = {"LD_PRELOAD": STAND_IN, "TAVO_DETECT": "0 0 5 2 2 0 -1 10 80", "TAVO_REACH": "2 3 " + "0 NOLISTEN " * 12}
        wide = lambda text: sum(1 + (char >= "\u1100") for char in text)
        for width in (40, 80):
            for arguments in ((), ("rules", "add", "--help"), ("routers",), ("test",), ("detect",), ("status",), ("rulse",),
                              ("service", "list"), ("save", "--dry-run")):
                text = on_terminal(*arguments, COLUMNS=str(width), NO_COLOR="1", **world)[1].replace("\r\n", "\n")
                text = text.split("\x1b[K\n")[-1]  # what the bar drew is no text
                for line in text.split("\n"):
                    # A command stays in one piece, to be copied; so does what has no blank to break it at.
                    if " " in line.strip() and not re.match(r"  +(?:sudo )?tavoportmap |      --", line):
                        self.assertLessEqual(wide(line), width, (arguments, line))
                run = subprocess.run([TOOL, *arguments], text=True, capture_output=True, env={**os.environ, **world})
                whole = re.sub(r"(?m)^ *\d+ %.*\n", "", run.stdout + run.stderr)
                words = lambda text: [word for word in re.sub(r"[\s,]+", " ", text).split() if not word.endswith("...")]
                self.assertFalse(set(words(text)) - set(words(whole)), arguments)
                cut = set(words(whole)) - set(words(text))
                self.assertLessEqual(cut, set(words(f"{model} {name}")), arguments)
                self.assertLess(len(cut), 9 if arguments == ("service", "list") else 8, arguments)  # of five columns
                for line in run.stdout.split("\n") if arguments == ("test",) else []:
                    self.assertRegex(line, r"^$|^rule |^[12] .* (80\d\d|80|443)/tcp ")  # a row a line, for scripts

    def test_a_held_lock_is_told_apart(self):
        tool("rules", "add", "--router-port", "80")
        self.saved()
        with held():
            for arguments in ("rules add --router-port 81", "rules remove 1", "save", "router show",
                              "router set --upnp no --natpmp yes", "detect", "open 81", "close 80", "off", "rules discard"):
                self.expect(arguments, BUSY, "another port-forwarding operation is running")
            self.expect("status", AWAY, "rules +1(?s:.)*running now +an operation that holds the router lock \\(python3\\)")
            self.assertEqual(self.json("save")[1]["status"], 2)
        self.expect("rules remove 1", OK, "noted")

    def test_without_root_the_way_out_is_sudo(self):
        for arguments in ("setup", "detect", "router show", "router set --upnp yes", "compat", "report"):
            self.expect(arguments, FAILED, r"^error: this command needs root: run it with sudo\n$", LD_PRELOAD=STAND_IN,
                        TAVO_UID="1000")
        self.store((1, "tcp", "443", "8443", "web"))
        os.chmod(RULES, 0)  # a file that may not be read is not one that is broken
        user = ("setpriv", "--bounding-set=-dac_override,-dac_read_search", "env", f"LD_PRELOAD={STAND_IN}", "TAVO_UID=1000")
        for command, code in (("cli/tavoportmap test", FAILED), ("cli/tavoportmap service list", FAILED),
                              ("cli/tavoportmap diag rules", FAILED), ("cli/tavoportmap rules list", FAILED),
                              ("programs/tavoupnptest", FAILED), ("programs/tavoupnptest -t", FAILED),
                              ("programs/tavoportforward", 3)):
            with self.subTest(command=command):
                run = subprocess.run([*user, *f"{BUILD}/{command}".split()], text=True, capture_output=True, check=False)
                self.assertEqual((run.returncode, run.stdout), (code, ""))
                self.assertRegex(run.stderr, "^[a-z]+: this (command )?needs root: run it with sudo\n$")

    def test_an_answer_that_cannot_be_written_is_a_failure(self):
        with open("/dev/full", "w", encoding="utf-8") as full:
            self.assertEqual(subprocess.run([TOOL, "rules", "list"], stdout=full, check=False).returncode, FAILED)

    def test_a_reader_that_goes_away_ends_no_save(self):
        for port, streams in enumerate(("2>/dev/full", "2>&-", ">&- 2>&- <&-", "2> >(exec true)"), 80):
            tool("rules", "add", "--router-port", str(port))
            known(most=100)
            run = subprocess.run(["bash", "-c", f"sleep .1; {TOOL} save {streams}"], env={**os.environ, **WRITES}, check=False, capture_output=True)
            self.assertEqual((run.returncode, str(port) in [rule["router_ports"] for rule in self.in_force()]),
                             (OK, True), streams)

    # ---- drafts -----------------------------------------------------------------------------------

    def test_edits_and_changes_by_others_come_together(self):
        """Rules before, edits, rules of others since, the rules that a save would have; (on, protocol, ports, box, name)."""
        web, dns, relay = (1, "tcp", "443", "8443", "web"), (1, "udp", "53", "53", "dns"), (1, "tcp", "5000", "5000", "hoplink")
        off = lambda rule: (0, *rule[1:])
        for before, edits, since, wanted in (
                ((web, dns), ("remove web", "add x --router-port 90"), (web, dns), (dns, (1, "tcp", "90", "90", "x"))),
                ((web, dns), ("edit web --box-port 9443", "disable dns"), (relay, dns, web),
                 (relay, off(dns), (1, "tcp", "443", "9443", "web"))),
                ((web, dns), ("remove 7",), (off(web), dns), (dns,)),
                ((web, dns), ("edit web --name site",), (dns,), (dns, (1, "tcp", "443", "8443", "site"))),
                ((web, dns), ("disable dns",), (web, (1, "udp", "53", "53", "names")), (web, (0, "udp", "53", "53", "names"))),
                ((web,), ("add dns --router-port 53 --protocol udp",), (web, dns), (web, dns)),
                ((web, (1, "tcp", "80-81", "80-81", "")), ("disable web",), (web, (1, "tcp", "80, 81", "80, 81", "")),
                 (off(web), (1, "tcp", "80, 81", "80, 81", ""))),
                ((web, dns), ("remove web", "remove dns"), (), ())):
            self.setUp()
            self.store(*before)
            for edit in edits:
                self.expect(f"rules {edit}", OK, "noted")
            self.assertEqual([row["router_ports"] for row in self.in_force()], [rule[2] for rule in before])
            self.store(*since)
            self.assertEqual([(on, protocol, ports, box, name) for _, on, protocol, ports, box, name in self.rows()],
                             list(wanted), (before, edits, since))
            self.saved()
            self.assertFalse(os.path.exists(DRAFT))

    def test_a_draft_of_as_many_rules_as_a_file_holds(self):
        rules = lambda first: [(1, "tcp", first + i, first + i, f"rule number {i}") for i in range(16000)]
        self.store(*rules(1))
        self.expect("rules remove 7", OK, "noted")
        self.assertEqual(len(self.rows()), 15999)
        self.store(*rules(20001))  # no rule is like any other one
        self.assertEqual(len(self.rows()), 16000)
        put("/tmp/more.json", json.dumps({"rules": [{"protocol": "udp", "router_ports": str(first), "box_ports": str(first)}
                                                    for first in range(1, 500)]}))
        self.expect("rules import /tmp/more.json", OK, "noted")
        self.expect("save", TOO_MANY, "holds 16384 rules and there are 16499")
        self.expect("rules discard", OK, "dropped|discarded|in force")
        self.assertEqual(len(self.rows()), 16000)

    def in_force(self):
        """What a daemon reads, whatever edits wait."""
        hidden = DRAFT + ".hidden"
        if os.path.exists(DRAFT):
            os.rename(DRAFT, hidden)
        rules = self.json("rules", "export")[1]["rules"]
        if os.path.exists(hidden):
            os.rename(hidden, DRAFT)
        return rules

    def test_a_draft_is_shown_kept_and_dropped(self):
        self.store((1, "tcp", "443", "8443", "web"))
        put(RULES, get(RULES) + '[9]\nenabled="1"\nprotocol name="tcp"\nr_port="1"\ns_port="1"\nservice="\\x80\\x01"\n')
        self.expect("rules disable 9", OK, "noted")
        self.expect("rules list", OK, r"disabled +tcp +1 +1 +\\x80\\x01 +changed, not saved\nnot saved yet: 'sudo tavoportmap save'")
        self.expect("rules enable 9", OK, "noted")
        self.assertFalse(os.path.exists(DRAFT), "nothing is left to save")
        self.expect("rules remove web", OK, "noted")
        self.expect("rules add new --router-port 90", OK, "rule 10 noted")
        self.expect("rules list", OK, r"10 +enabled +tcp +90 +90 +new +new, not saved\n7 +removed .*not saved")
        known(most=1)
        self.expect("save", TOO_MANY, "Nothing was changed(?s:.)*The edits stay noted")
        for damage in (lambda: put(DRAFT, "{}"), lambda: put(DRAFT, '{"base":' + "[" * 9000), lambda: put(DRAFT, ""),
                       lambda: os.makedirs(f"{DRAFT}/x"), lambda: os.symlink(RULES, DRAFT)):
            os.path.exists(DRAFT) and os.unlink(DRAFT)
            damage()
            for arguments in ("rules list", "rules add --router-port 91", "save", "rules export"):
                self.expect(arguments, FAILED, "edits that are not saved yet cannot be read .*'sudo tavoportmap rules discard'")
            self.assertTrue(os.path.exists(DRAFT))
            self.expect("rules discard", OK, "the edits are dropped")
        self.expect("rules discard", OK, "nothing to drop")
        self.assertEqual([row[0] for row in self.rows()], ["7", "9"])

    def test_a_dry_run_tells_port_by_port(self):
        self.store((1, "tcp", "80-81", "80-81", "web"), (1, "udp", "53", "53", "dns"), (1, "tcp", "5000", "5000", "x"))
        world = {"LD_PRELOAD": STAND_IN, "TAVO_USED": "TCP:5000 TCP:90"}
        known(brand="Zeta", most=5)
        for edit in ("remove dns", "edit web --box-port 80,8081", "add --router-port 6000-6002 --protocol udp",
                     "add --router-port 81 --force", "add --router-port 90"):
            self.expect(f"rules {edit}", OK, "noted")
        code, told = self.json("save", "--dry-run", **world)
        self.assertEqual((code, told["table_read"]), (REFUSED, True))
        self.assertEqual({(port["action"], port["router_ports"], port["protocol"]) for port in told["ports"]},
                         {("keep", "80", "tcp"), ("change", "81", "tcp"), ("refuse", "81", "tcp"), ("close", "53", "udp"), ("open", "6000-6002", "udp"),
                          ("refuse", "90", "tcp"), ("refuse", "5000", "tcp")})
        self.assertEqual({port["router_ports"] for port in told["ports"] if port["why"]}, {"81", "90", "5000"})
        self.expect("save --dry-run", REFUSED, r"refuse +90/tcp +another device has it on the router \(192.168.77.99, console\\x1b", **world)
        self.expect("save --dry-run", REFUSED, r"change +81/tcp +to port 8081 of this box\n(?s:.)*refuse +81/tcp +rule \d+ wants it too", **world)
        tool("rules", "add", "--router-port", "91")
        self.expect("save --dry-run", TOO_MANY, "holds 5 rules and there are 6", **world)
        self.assertEqual(len(self.in_force()), 3)

    def test_rules_travel_as_a_document(self):
        self.store((1, "tcp", "80,443", "80,8443", "web"), (0, "all", "53", "53", "dns"))
        document = tool("rules", "export")[1]
        rules = self.rows()
        for text, pattern in (("{", "no JSON document"), ('{"a": 1}', "no list of rules"), ("[5]", "rule 1 .*no object"),
                              ('[{"router_ports": "1"}, {"box_ports": "1"}]', 'rule 2 .*"router_ports" is missing'),
                              ('[{"router_ports": 1, "box_port": 1}]', 'did you mean "box_ports"'),
                              ('[{"router_ports": "1-2", "box_ports": "1"}]', "2 router ports but 1 box ports"),
                              ('[{"router_ports": 1, "protocol": "sctp"}]', "none of tcp, udp, all"),
                              ('[{"router_ports": 1, "enabled": "no"}]', "neither true nor false"),
                              ("[" * 9000, "nested too deeply"), ('[{"router_ports": 1, "router_ports": 2}]', "Duplicate key"),
                              ('[{"router_ports": 1, "name": "a\\u0000b"}]', "NUL"),
                              ('[{"router_ports": "5,6,5", "box_ports": "1-3"}]', "router port 5 is named twice"),
                              ('[{"router_ports": 99}, {"router_ports": 443}]', "rule 7 already forwards router port 443/tcp")):
            put("/tmp/rules.json", text)
            self.expect("rules import /tmp/rules.json", USAGE, f"{pattern}(?s:.)*Nothing was changed")
            self.assertFalse(os.path.exists(DRAFT), text)
        code, out, err = tool("rules", "import", "-", stdin='[{"router_ports": 99}]')
        self.assertEqual((code, self.rows()[2]), (OK, ("9", True, "tcp", "99", "99", "")), out + err)
        self.assertEqual(tool("rules", "import", "--replace", "-", stdin=document)[0], OK)
        self.assertEqual([row[1:] for row in self.rows()], [row[1:] for row in rules])
        for path in ("/tmp/nothing", "/tmp", "/dev/zero"):
            self.expect(f"rules import {path}", FAILED, f"'{path}' cannot be read")

    # ---- one command ------------------------------------------------------------------------------

    def test_ports_are_opened_and_closed_in_one_command(self):
        """Rules before, the command, its exit code and words, the rules in force then."""
        web, span = (1, "tcp", "443", "8443", "web"), (1, "all", "5000-5004", "5000-5004", "")
        shop = (1, "tcp", "80", "8080", "shop")
        off = lambda rule: (0, *rule[1:])
        put("/etc/services", "domain 53/tcp\ndomain 53/udp\nzero 0/tcp\nodd 70000/tcp even\nlast 65535/tcp\nother 7070/tcp even # odd\n")
        for before, command, code, pattern, after in (
                ((), "open zero", USAGE, "'zero' is neither", ()),
                ((), "open odd", USAGE, "'odd' is neither", ()),
                ((), "open last", OK, "port 65535 .tcp.", ((1, "tcp", "65535", "65535", "last"),)),
                ((), "open even", OK, "port 7070 .tcp.", ((1, "tcp", "7070", "7070", "even"),)),
                ((), "open 443 --to 8443 --name web", OK, "port 443 .tcp. is open(?s:.)*leads to port 8443", (web,)),
                ((web,), "open https --to 8443", OK, "was open already on the router and leads", (web,)),
                ((off(web),), "open 443 --to 8443", OK, "is open", (web,)),
                ((web,), "open 443", USAGE, r"leads to port 8443 of this box already, by rule 7 \(web\); .*close 443/tcp", (web,)),
                ((web,), "open web --to 80,8443", OK, "port 80,443 .tcp. is open", (web, (1, "tcp", "80", "80", "web"))),
                ((), "open minecraft", OK, "port 25565 .tcp.", ((1, "tcp", "25565", "25565", "minecraft"),)),
                ((), "open domain/udp --yes", OK, "port 53 .udp.", ((1, "udp", "53", "53", "domain"),)),
                ((), "open minecarft", USAGE, "did you mean 'minecraft'", ()),
                ((), "open ssh", USAGE, "guessed passwords(?s:.)*add --yes", ()),
                ((), "open 4445 --to 445", USAGE, "file sharing(?s:.)*add --yes", ()),
                ((), "open 5000-4000", USAGE, "'5000-4000' is a range written backwards; if you mean it, write 4000-5000", ()),
                ((), "open 1,9-9,8-7/udp", USAGE, "'8-7' is a range written backwards", ()),
                ((), "open 8000-8001 --to 9001-9000", USAGE, "'9001-9000' is a range written backwards", ()),
                ((), "rules add --router-port 5000-4000", USAGE, "written backwards", ()),
                ((), "service plan hoplink 5001-5000/tcp", USAGE, "written backwards", ()),
                ((span,), "close 5004-5000", USAGE, "written backwards", (span,)),
                ((), "open 443 --to 80,81", USAGE, "1 router ports but 2 box ports", ()),
                (((1, "TCP", "443", "8443", "web"), (1, "Tcp_Udp", "53", "53", "")), "close 443 53/udp", OK, "closed; 1 rule",
                 ((1, "tcp", "53", "53", ""),)),
                (((1, "both", "443", "443", ""),), "open 443", OK, "was open", ((1, "all", "443", "443", ""),)),
                ((web, span), "close 443", OK, "443/tcp closed; 1 rule in force", (span,)),
                ((web, span), "close web", OK, "443/tcp closed", (span,)),
                ((shop,), "close web", USAGE, r"nothing was closed: no rule is called 'web'. Rule 7 \(shop\) forwards 80/tcp; .*close 80/tcp'", (shop,)),
                ((shop,), "close 53 http", USAGE, "no rule is called 'http'", (shop,)),
                ((off(web), shop), "close web", OK, "nothing to close", (off(web), shop)),
                (((1, "tcp", "80,90", "80,90", "web"), shop), "close web", OK, "80,90/tcp closed; 1 rule", (shop,)),
                (((1, "tcp", "443", "443", ""), shop), "close web", OK,
                 r"(?s)443/tcp closed; 1 rule in force.*warning: Rule 8 \(shop\) forwards 80/tcp", (shop,)),
                (((1, "tcp", "22", "22", "ssh"), shop), "close ssh/tcp", OK, "22/tcp closed", (shop,)),
                ((shop,), "close 80", OK, "80/tcp closed", ()),
                ((span,), "close 5002/udp", OK, "closed", ((1, "tcp", "5000-5004", "5000-5004", ""),
                                                           (1, "udp", "5000-5001,5003-5004", "5000-5001,5003-5004", ""))),
                ((span,), "close 5000-5002", OK, "closed", ((1, "all", "5003-5004", "5003-5004", ""),)),
                ((off(web),), "close 443", OK, "nothing to close", (off(web),)),
                ((span,), "close 443", OK, "nothing to close", (span,)),
                (((1, "tcp", "80", "80", "443"), web), "close 443", OK, "443/tcp closed", ((1, "tcp", "80", "80", "443"),)),
                ((web,), "close wbe", USAGE, "neither a port nor the name of a rule", (web,)),
                ((off(web),), "off", OK, "nothing to switch off", (off(web),)),
                ((web,), "on", OK, "nothing to switch on", (web,))):
            self.setUp()
            known(most=9)
            self.store(*before)
            tool("rules", "add", "unsaved", "--router-port", "7777")
            self.expect(command, code, pattern, **WRITES)
            key = lambda rule: (rule["enabled"], rule["protocol"], rule["router_ports"], rule["box_ports"], rule["name"])
            self.assertEqual([key(rule) for rule in self.in_force()], list(after), command)
            self.assertEqual([row[3] for row in self.rows() if row[5] == "unsaved"], ["7777"], "the edit still waits")

    def test_a_rule_file_that_is_another_one_after_the_save_is_pointed_out(self):
        known(most=9)
        self.store((1, "tcp", "443", "8443", "web"))
        for command in ("open 80", "close 443", "off"):
            self.expect(command, OK, "warning: somebody else has changed", LD_PRELOAD=STAND_IN, TAVO_SAVE="0 0")

    def test_without_a_word_on_these_rules_nothing_is_called_done(self):
        for command in ("open 80", "close 443", "off"):
            for said in (False, True):  # nothing at all, or of the rules before in the same second
                pid = self.keep(most=9)
                if said:
                    self.publish(pid, at=int(time.time()) + 60)
                self.expect(command, FAILED, "upnpd has not said what became of them(?s:.)*df /run", **WRITES)

    def test_an_address_that_nobody_outside_reaches_is_no_address_to_try(self):
        pid = self.keep(most=9)
        for outside, kind, pattern in (("198.41.0.4", "public", "from outside it is https://198.41.0.4/(?!(?s:.)*nobody on the Internet)"),
                                       ("192.168.0.9", "private", "warning: .*another router stands(?s:.)*nobody on the Internet"),
                                       ("100.64.0.9", "carrier", "warning: .*the provider's own(?s:.)*nobody on the Internet")):
            self.publish(pid, outside=outside, at=int(time.time()) + 60)
            self.expect("open 443 --to 8443", OK, pattern, **WRITES)
            self.assertEqual(self.json("open", "443", "--to", "8443", **WRITES)[1]["outside_kind"], kind)

    def test_the_outcome_of_a_save_is_what_the_daemon_says(self):
        refused = (443, "tcp", {"state": "refused", "why": "taken", "holder": {"address": "192.168.77.7", "description": "console"}})
        left = {"name": "8080/tcp", "address": "192.168.77.9", "why": "its former address", "until": None}
        shared = (5001, "tcp", {"state": "refused", "why": "another rule has this port of the box; the router gives it one router port only"})
        for rows, members, code, pattern in (
                ((), {}, OK, "2 rules in force"),
                ((refused,), {}, REFUSED, r"443/tcp +refused +taken \(192.168.77.7, console\)(?s:.)*Choose other router ports"),
                ((shared,), {}, REFUSED, "other rule has this port(?s:.)*the others are in force. Choose another port of this box .*--box-port"),
                ((refused, shared), {}, REFUSED, "Choose other router ports(?s:.)*and another port of this box"),
                (((53, "udp", {"state": "waiting", "why": "busy"}),), {}, REFUSED, "53/udp +not yet +busy"),
                ((), {"left_over": [left]}, REFUSED, "8080/tcp +still on the router +its former address"),
                ((refused,), {"router": "unreachable"}, AWAY, "nothing was refused, and what is open there is not known(?s:.)*the daemon brings"),
                ((), {"router": "no_upnp"}, AWAY, "does not offer UPnP(?s:.)*switch UPnP on"),
                ((), {"router": "silent"}, AWAY, "192.168.77.1 does not answer(?s:.)*restart the router")):
            pid = self.keep(most=100)
            self.publish(pid, *rows, at=int(time.time()) + 60, **members)
            self.expect("save", code, pattern, **WRITES)
            told = self.json("save", **WRITES)[1]
            self.assertEqual(({port["name"] for port in told["ports"] if port["state"] != "open"}, len(told.get("left_over", []))),
                             ({f"{port}/{protocol}" for port, protocol, _ in rows}, len(members.get("left_over", []))))
        self.publish(pid, refused, at=int(time.time()) + 60)
        self.expect("open 53/udp --yes", REFUSED, "(?s)443/tcp.*Port 53 itself, which was asked for, is open", **WRITES)

    def test_without_the_router_close_and_off_hold_on_this_box(self):
        """And whoever tells the router later is named: a daemon, or for a router's pages the user."""
        pid = self.keep()
        for upnp, program, later in (("yes", "upnpd", "the daemon brings the router in line"),
                                     ("no", "tavoportforward", "'sudo tavoportmap {}' tells it again when it is back")):
            self.setUp()
            describe("Acme", "R1", "1")
            put(ROUTER, KNOWN % (upnp, "no") + 'conn_type="http"\nconn_port="80"\n')
            put(DATABASE, '[Acme/R1/1]\nsupport="yes"\nmax="9"\n')
            self.store((1, "tcp", "443", "443", "web"), (1, "tcp", "80", "80", ""))
            for command, left, pattern, again in (("close web", (80,), "443/tcp closed on this box, not yet on the router", "save"),
                                                  ("off", (), "every port is switched off on this box, not yet on the router", "off"),
                                                  ("off", (), "every port is switched off on this box, not yet on the router", "off"),
                                                  ("close 80", (), "80/tcp closed on this box, not yet on the router", "save")):
                rows = [{"name": f"{port}/tcp", "router_port": port, "box_port": port, "protocol": "tcp", "rule": "x", "state": "unknown",
                         "word": "", "why": None, "holder": None, "since": None, "until": None} for port in left]
                self.publish(pid, name=program, protocol="pages" if upnp == "no" else "UPnP", router="unreachable",
                             rules=rows, at=int(time.time()) + 60)
                self.expect(command, AWAY, f"{pattern}(?s:.)*cannot be reached(?s:.)*{later.format(again)}", **WRITES)
            self.assertEqual(self.in_force(), [])

    def test_what_pages_did_not_do_leads_to_their_account_and_their_port(self):
        pid = self.keep()
        describe("Acme", "R1", "1")
        put(ROUTER, KNOWN % ("no", "no") + 'conn_type="http"\nconn_port="80"\n')
        self.store((1, "tcp", "443", "443", "web"))
        for state, why, router, code, pattern in (
                ("refused", "the router does not accept the user name or the password", "ok", REFUSED, "router set --ask-password' stores"),
                ("refused", "another device has this port on the router", "ok", REFUSED, "Choose other router ports"),
                ("unknown", "no web server", "unreachable", AWAY, "the pages of the router 192.168.77.1 cannot be (?s:.)*router show'")):
            row = {"name": "443/tcp", "router_port": 443, "box_port": 443, "protocol": "tcp", "rule": "web", "state": state,
                   "word": "", "why": why, "holder": None, "since": None, "until": None}
            self.publish(pid, name="tavoportforward", protocol="pages", router=router, rules=[row], at=int(time.time()) + 60)
            self.expect("save", code, pattern, **WRITES)
        put("/etc/tavoinfo.conf", "")
        self.expect("status", FAILED, "1 of 1 rule cannot be told: the router's pages did not answer .*tavoportmap save'")

    def test_setup_offers_what_listens_here_and_opens_what_is_chosen(self):
        world = {**WRITES, "TAVO_DETECT": "0 0 0 1 1 0 32 10 20 30 40 70 50 80", "TAVO_WORD": "1 -1"}
        with contextlib.ExitStack() as keep:
            for address, port in (("0.0.0.0", 445), ("127.0.0.1", 7101), ("0.0.0.0", 7102), ("192.168.77.2", 7103), ("0.0.0.0", 7104)):
                bound(keep, address, port)
            for port in (7105, 5353, 40000):  # the last is one that a program is given which only asks
                bound(keep, "0.0.0.0", port, socket.SOCK_DGRAM)
            self.store((1, "tcp", "80", "7104", "web"))
            told = self.json("setup", "--yes", **world)[1]["could_be_opened"]
            self.assertEqual([(entry["port"], entry["protocol"], bool(entry["risk"])) for entry in told],
                             [(445, "tcp", True), (7102, "tcp", False), (7103, "tcp", False), (7105, "udp", False)])
            self.expect("setup --yes", OK, "(?s)445 +\\S+ +better not: .*7105/udp.*'sudo tavoportmap open 7102' opens the first", **world)
            self.expect("off", OK, "every port is closed", **WRITES)
            code, text = on_terminal("setup", **world)
            self.assertEqual((code, "Which of them" in text, "open 7102" in text), (OK, False, False), text)
            self.assertIn("'sudo tavoportmap on' comes before", text)
            for typed, opened in ((b"\n", []), (b"no\n", []), (b"7102, 7105/udp\n", ["7102", "7105"]), (b"445\nn\n", [])):
                self.store((1, "tcp", "80", "7104", "web"))
                os.unlink(ROUTER)
                code, text = on_terminal("setup", typed=typed, **world)
                self.assertEqual([rule["router_ports"] for rule in self.in_force()], ["80", *opened], text)
                self.assertEqual(code, FAILED if b"445" in typed else OK, text)
            for port, words in (("7101", "only for this box itself \\(127.0.0.1\\): have it listen on every"),
                                ("7109", "no program of this box waits at tcp port 7109 yet"), ("7103", "is open")):
                self.expect(f"open {port}", OK, words, **world)

    def test_off_is_off_until_on(self):
        known(most=9)
        self.store((1, "tcp", "443", "8443", "web"), (0, "tcp", "90", "90", "never"), (1, "udp", "53", "53", "dns"))
        self.expect("off", FAILED, "could not be written", LD_PRELOAD=STAND_IN, TAVO_SAVE="-1 0")
        self.assertFalse(os.path.exists(OFF))
        self.expect("off", OK, "every port is closed", **WRITES)
        self.assertEqual([rule["enabled"] for rule in self.in_force()], [False] * 3)
        self.expect("rules add new --router-port 91", OK, "'sudo tavoportmap on' comes first", **WRITES)
        for command in ("router set --max-rules 9", "rules list"):
            self.expect(command, OK, "'sudo tavoportmap on'(?!(?s:.)*tavoportmap save)", **WRITES)
        for command in ("open 92", "save", "service set hoplink 80/tcp"):
            self.expect(command, FAILED, "every port is switched off(?s:.)*tavoportmap on", **WRITES)
        self.expect("off", OK, "switched off already", **WRITES)
        noted = get(OFF)
        put(OFF, '{"rules":' + "[" * 9000)
        lost = "cannot be read .*rules.off.*'sudo tavoportmap rules enable RULE'"
        for command, code in (("on", FAILED), ("service set hoplink 80/tcp", FAILED), ("status", OK), ("rules list", OK)):
            self.expect(command, code, lost, **WRITES)
        self.assertEqual([rule["enabled"] for rule in self.in_force()], [False] * 3)
        put(OFF, noted)
        self.expect("on", OK, "2 rules in force", **WRITES)
        self.assertEqual([(rule["name"], rule["enabled"]) for rule in self.in_force()],
                         [("web", True), ("never", False), ("dns", True)])
        self.assertFalse(os.path.exists(OFF))
        self.assertEqual(len(self.rows()), 4)
        # What is closed meanwhile stays closed: a whole rule, a part of one, none, and the last.
        tool("rules", "discard")
        self.store((1, "tcp", "443", "8443", "web"), (0, "tcp", "90", "90", "never"), (1, "all", "53-55", "53-55", "dns"))
        on = lambda: [(rule["name"], rule["protocol"], rule["router_ports"]) for rule in self.in_force() if rule["enabled"]]
        self.expect("off", OK, "every port is closed", **WRITES)
        self.expect("close web", FAILED, "could not be written", LD_PRELOAD=STAND_IN, TAVO_SAVE="-1 0")
        self.assertEqual(get(OFF).count('"name"'), 2)
        self.expect("close web", OK, "switched off already; 443/tcp will not be opened again .*, which brings back the others", **WRITES)
        self.expect("close 54/udp", OK, "54/udp will not be opened again", **WRITES)
        self.expect("close never", OK, "nothing to close", **WRITES)
        self.assertEqual((on(), self.json("rules", "list")[1]["off"]), ([], True))
        self.expect("on", OK, "rules in force", **WRITES)
        self.assertEqual(on(), [("dns", "tcp", "53-55"), ("dns", "udp", "53,55")])
        self.expect("off", OK, "every port is closed", **WRITES)
        self.expect("close dns", OK, "will not be opened again .*, and no other one waits", **WRITES)
        self.expect("on", OK, "nothing to switch on", **WRITES)
        self.assertEqual([rule["name"] for rule in self.in_force()], ["never"])
        self.store((1, "tcp", "443", "8443", "web"), (0, "tcp", "90", "90", "never"), (1, "udp", "53", "53", "dns"))
        put(OFF, noted)  # of an 'off' or 'on' that was killed
        self.expect("close web dns", OK, "closed", **WRITES)
        self.assertFalse(self.json("rules", "list")[1]["off"])
        self.expect("on", OK, "nothing to switch on", **WRITES)
        put(OFF, noted)
        self.expect("open 92", OK, "port 92 .tcp. is open", **WRITES)

    # ---- saving ---------------------------------------------------------------------------------

    def test_every_status_of_saving_is_explained(self):
        tool("rules", "add", "--router-port", "80")
        known()
        for answer, code, pattern in (
                ("0 0", OK, "1 rule in force on the router 192.168.77.1"),
                ("-1 2", BUSY, "another port-forwarding operation"),
                ("-1 7 5", TOO_MANY, "holds 5 rules and there are 1\nNothing was changed"),
                ("-1 8 5000/tcp, 53/udp", REFUSED, "already holds these ports.*: 5000/tcp, 53/udp\nThe other rules are in force"),
                ("-1 8 \x1b[31m", REFUSED, r"router: \\x1b\[31m"),
                ("-1 9 80/tcp", REFUSED, "not open on the router: 80/tcp(?s:.)*upnp_portmap.status"),
                ("-1 10 -1", TOO_MANY, "do not fit this router"),
                ("-1 10 4", TOO_MANY, "4 single ports and no ranges"),
                ("-1 10 0", TOO_MANY, "holds no single ports and no ranges"),
                ("-1 11 4", TOO_MANY, "4 places, each of them one port or one range"),
                ("-1 12 4 2", TOO_MANY, "4 single ports and 2 ranges"),
                ("-1 0", FAILED, "could not be written(?s:.)*old rules are in force(?s:.)*edits stay noted"),
                ("-1 0 write", AWAY, "are stored, but upnpd could not be started(?s:.)*journalctl -t upnpd")):
            self.expect("save", code, pattern, LD_PRELOAD=STAND_IN, TAVO_SAVE=answer)
            self.assertEqual(self.json("save", LD_PRELOAD=STAND_IN, TAVO_SAVE=answer)[1]["status"], int(answer.split()[1]))
        known("yes", "yes")
        self.expect("save", REFUSED, "would not give these ports.*80 to 81", LD_PRELOAD=STAND_IN, TAVO_SAVE="-1 8 80 to 81")
        known("no", "no")
        describe("Acme", "R1", "1")
        self.expect("save", OK, "handed to(?s:.)*warning: .*did not say what they took", LD_PRELOAD=STAND_IN, TAVO_SAVE="0 0")

    def test_saving_by_the_library_itself(self):
        tool("rules", "add", "--router-port", "80")
        self.expect("save", FAILED, "nothing is known of the router 192.168.77.1 yet(?s:.)*tavoportmap setup")
        put(ROUTER, (KNOWN % ("yes", "no")).replace(GATEWAY, "10.0.0.1").replace("R1", "R2"))
        self.expect("save", FAILED, r"is about another router \(10.0.0.1\) than 192.168.77.1")
        put(ROUTER, (KNOWN % ("yes", "no")).replace("R1", "R2"))
        self.expect("save", FAILED, r"how many rules the router Acme R2 \(1\) holds(?s:.)*--max-rules")
        known("no", "no")
        self.expect("save", FAILED, r"no description of the router Acme R1 \(1\)(?s:.)*tavoportmap routers  +shows(?!(?s:.)*--update)")
        put("/etc/tavo/platform.conf", '[download]\ndatabase_url="http://127.0.0.1:1"\n')
        self.expect("save", FAILED, r"no description of the router Acme R1 \(1\)(?s:.)*sudo tavoportmap routers --update  ")
        os.unlink("/etc/tavo/platform.conf")
        known()
        tool("rules", "add", "--router-port", "81")
        self.expect("save", TOO_MANY, "holds 1 rule and there are 2")
        known("no", "no")
        describe("Acme", "R1", "1")
        for edit, code, pattern in (("add --router-port 82,83", OK, "open +80-83/tcp"),
                                    ("add more --router-port 84", TOO_MANY, "holds 4 single ports and no ranges"),
                                    ("edit more --router-port 84-85", TOO_MANY, "holds 4 single ports and no ranges")):
            self.expect(f"rules {edit}", OK, "noted")
            self.expect("save --dry-run", code, pattern, LD_PRELOAD=STAND_IN)

    def test_the_bar_never_goes_back_and_ends_its_line(self):
        steps = "10 20 30 40 70 50 80"
        known()
        for command, environment in ((("save",), {"TAVO_SAVE": "-1 9 80/tcp"}),
                                     (("compat", "--yes"), {"TAVO_COMPAT": "1 0 Acme no -1 10 20 30 60 40 50"}),
                                     (("detect",), {"TAVO_DETECT": f"-1 4 0 1 2 2 -1 {steps}"})):
            code, text = on_terminal(*command, LD_PRELOAD=STAND_IN, **environment)
            percents = [int(percent) for percent in re.findall(r"(\d+) %", text)]
            self.assertNotEqual(code, OK)
            self.assertGreaterEqual(len(percents), 4)
            self.assertEqual(percents, sorted(percents))
            bar, verdict = text.split("\r\n", 1)
            self.assertEqual(bar.count("\r"), len(percents))
            self.assertIn("error", verdict)
            self.assertNotIn("\r[", verdict)
        self.assertIn("trying to resolve a name", bar)

    # ---- the router -----------------------------------------------------------------------------

    def test_verdicts_of_detection(self):
        steps = "10 20 30 40 70 50 80"
        for answer, word, code, pattern in (
                (f"0 0 0 1 1 0 32 {steps}", "1 -1", OK,
                 r"driven by +UPnP\n(?s:.)*Acme\\x1b(?s:.)*holds +32 rules(?s:.)*--last --save"),
                (f"0 0 0 1 2 1 0 {steps}", "1 0 198.51.100.7 1", OK, "NAT-PMP(?s:.)*no limit known(?s:.)*outside +198.51.100.7"),
                (f"0 0 0 1 0 0 -1 {steps}", "1 -1", OK,
                 "(?s)answers neither UPnP nor NAT-PMP.*http://192.168.77.1/, then run 'sudo tavoportmap setup'.*--conn-type http"),
                (f"0 0 0 1 0 0 -1 {steps}", "1 0 198.51.100.7 1", OK, "answers NAT-PMP; 'sudo tavoportmap setup'"),
                (f"0 0 0 1 0 0 -1 {steps}", "1 2", OK, "refuses to be used: switch it, or UPnP, on"),
                (f"0 0 0 0 0 0 -1 {steps}", "1 -1", OK, "no router stands in the way"),
                (f"0 0 0 1 0 0 -1 {steps} able", "1 -1", OK, "database says that its model cannot be relied on; 'sudo tavoportmap setup'"),
                (f"0 0 0 1 2 0 -1 {steps}", "1 -1", OK, "nobody has recorded how far its model(?s:.)*'sudo tavoportmap setup'"),
                (f"0 0 5 2 1 0 32 {steps}", "1 0 10.0.0.2 2", OK,
                 "(?s)gateway setting.*double NAT.*bridge.*outer router, too.*public address"),
                (f"0 0 4 2 1 0 32 {steps}", "1 0 100.64.0.2 3", OK, "(?s)warning: the provider translates.*public IPv4 address"),
                (f"0 0 2 -1 1 0 32 {steps}", "1 -1", OK, "could not be found out whether another router"),
                (f"-1 0 0 1 1 0 -1 {steps}", "1 -1", OK, "(?s)driven by +UPnP.*recorded how many rules.*--max-rules"),
                ("-1 2 0 0 0 0 -1 10", "1 -1", BUSY, "another port-forwarding operation"),
                ("-1 3 0 0 0 0 -1 10 20 30 40", "1 -1", FAILED, "is there, but the Internet cannot be reached"),
                ("-1 3 0 0 0 0 -1 10 20 30 40", "0 -1", FAILED, "router 192.168.77.1 does not answer at all"),
                ("-1 4 0 1 0 0 -1 10 20 30 40 70 50", "1 -1", FAILED, "names cannot be resolved"),
                ("-1 0 0 0 0 0 -1 10 20", "1 -1", FAILED, "no network interface is up")):
            world = {"LD_PRELOAD": STAND_IN, "TAVO_DETECT": answer, "TAVO_WORD": word}
            self.expect("detect", code, pattern, **world)
            self.assertEqual(self.json("detect", **world)[0], code)

    def test_setup_leads_from_nothing_to_a_known_router(self):
        """Each case: what detection, the gateway and the test say; exit code and words; what is stored then."""
        steps = "10 20 30 40 70 50 80"
        passed, failed = "0 0 Acme yes 32 10 20 30 60 40 50 70 80 90", "1 0 Acme no -1 10 20 30"
        pages = (KNOWN % ("no", "no")) + 'conn_type="http"\nconn_port="80"\nuser="me"\n'
        for before, detected, word, tested, code, pattern, stored in (
                ("", f"0 0 0 1 1 0 32 {steps}", "1 -1", passed, OK, "is known now and is driven by UPnP", ("yes", "no")),
                ("", f"0 0 0 1 2 0 -1 {steps}", "1 0 198.51.100.7 1", passed, OK, "known now(?s:.)*UPnP", ("yes", "no")),
                ("", f"0 0 0 1 2 0 -1 {steps}", "1 0 198.51.100.7 1", failed, OK, "UPnP failed the test.*NAT-PMP is used", ("no", "yes")),
                ("", f"0 0 0 1 2 0 -1 {steps}", "1 -1", failed, FAILED,
                 "(?s)did not take the test mappings.*newer firmware.*--trust-upnp.*routers BRAND", None),
                ("", f"0 0 0 1 2 0 -1 {steps}", "1 -1", "-1 13 - - 0 10 20", FAILED, "no router answered", None),
                ("", f"0 0 0 1 0 0 -1 {steps}", "1 0 198.51.100.7 1", "", OK, "driven by NAT-PMP", ("no", "yes")),
                ("", f"0 0 0 1 0 0 -1 {steps}", "1 3", "", OK, "driven by NAT-PMP(?s:.)*no connection outside now",
                 ("no", "yes")),
                ("", f"0 0 0 1 0 0 -1 {steps} able", "1 -1", "", FAILED, "(?s)use it all the same.*router set --brand 'Acme", None),
                ("", f"0 0 0 1 0 0 -1 {steps}", "1 -1", "", FAILED, "(?s)http://192.168.77.1/, then run 'sudo tavoportmap setup' again", None),
                (KNOWN % ("yes", "no"), f"0 0 0 1 0 0 -1 {steps}", "1 -1", "", FAILED, "stored of it stays as it is", ("yes", "no")),
                (pages, f"0 0 0 1 1 0 -1 {steps}", "1 -1", "", OK, "own pages(?s:.)*router set --upnp yes", ("no", "no")),
                ("\0\1 no settings", f"0 0 0 1 1 0 32 {steps}", "1 -1", "", OK, "kept as .*router.conf.unreadable", ("yes", "no")),
                ("", "-1 3 0 0 0 0 -1 10 20 30 40", "0 -1", "", FAILED, "is the cable", None)):
            self.setUp()
            describe("Acme", "R1", "1")
            if before:
                put(ROUTER, before)
            world = {"LD_PRELOAD": STAND_IN, "TAVO_DETECT": detected, "TAVO_WORD": word, "TAVO_COMPAT": tested}
            self.expect("setup --yes", code, pattern, **world)
            words = tuple(re.findall(r'support_router_\w+="(\w+)"', get(ROUTER))) if os.path.exists(ROUTER) else None
            self.assertEqual(words, stored, (detected, word, tested))
            if " 1 1 0 " in detected and not before.startswith("["):
                self.expect("setup", OK, "known now", **world)  # anew
        world = {"LD_PRELOAD": STAND_IN, "TAVO_DETECT": f"0 0 0 1 2 0 -1 {steps}", "TAVO_COMPAT": passed}
        self.setUp()
        self.expect("setup", FAILED, "setup --yes +tests it and stores", **world)
        self.assertFalse(self.json("setup", **world)[1]["ok"])
        code, text = on_terminal("setup", typed=b"n\n", **world)
        self.assertEqual((code, "Test it now?" in text, os.path.exists(ROUTER)), (FAILED, True, False), text)
        code, text = on_terminal("setup", typed=b"y\n\n", **world)
        self.assertEqual((code, os.path.exists(ROUTER)), (OK, True), text)

    def test_the_child_of_detection_says_nothing(self):
        for ending in ("child", "child callback"):
            code, out, err = tool("detect", LD_PRELOAD=STAND_IN, TAVO_DETECT=f"0 0 0 1 1 0 32 10 80 {ending}")
            self.assertEqual((code, out.count("gateway "), err.count("80 %")), (OK, 1, 1), out + err)

    def test_settings_round_trip(self):
        self.expect("router show", OK, "nothing is stored for the router 192.168.77.1 yet")
        self.expect("router set --brand Acme --upnp no", USAGE, "needs --conn-type and --conn-port")
        self.expect("router set --upnp yes --brand Acme --model R9 --version 2", OK, "stored as the settings")
        self.expect("router show", OK, "driven by +UPnP\n(?s:.)*holds +no limit known")
        self.expect("router set --max-rules 20", OK, "stored as the settings")
        self.expect("detect --last --max-rules 20", USAGE, "with --save")
        self.expect("router show", OK, "model +R9\n(?s:.)*holds +20 rules\n")
        self.expect("router set --brand AirPort --max-rules 21", OK, "stored as the settings")
        self.assertEqual(self.json("router", "show")[1]["router"]["max_rules"], 21)
        self.expect("router set --brand Acme --model R1 --version 1 --max-rules 20", FAILED,
                    "says that this router holds 1 rules")
        self.assertEqual(self.json("router", "show")[1]["router"]["max_rules"], 1)
        self.expect("status", OK, r"settings +Acme R1 \(1\), driven by UPnP")
        self.expect("detect --save", OK, "stored as the settings", LD_PRELOAD=STAND_IN,
                    TAVO_DETECT="0 0 0 1 0 1 32 10 80")
        self.assertEqual(self.json("router", "show")[1]["router"]["natpmp"], "yes")

    def test_settings_that_cannot_be_read_stay(self):
        put(ROUTER, "\0\1 no settings\n")
        self.expect("router show", FAILED, "cannot be read as settings; it was left as it is")
        self.expect("router set --upnp yes", FAILED, "cannot be read as settings")
        self.assertEqual(get(ROUTER), "\0\1 no settings\n")

    def test_the_password_is_shown_only_on_request(self):
        manual = (KNOWN % ("no", "no")) + 'conn_type="http"\nconn_port="80"\nuser="admin"\npass="s3cret"\n'
        put(ROUTER, manual + 'use_custom_account="yes"\n')
        self.expect("router show", OK, "password +set, not shown(?s:.)*http, port 80")
        self.assertNotIn("s3cret", tool("--json", "router", "show")[1])
        self.expect("router show --show-password", OK, "password +s3cret\n")
        self.expect("router set --user root", USAGE, "no terminal to ask.*--password-file")
        # A manual router is stored only with a description that the tool which carries it out understands.
        describe("Acme", "R1", "1")
        code, _, err = tool("router", "set", "--password-file", "-", stdin="n3w\nrest\n")
        self.assertEqual((code, "newer than the tool" in err), (FAILED, True), err)
        self.expect("router show --show-password", OK, "password +s3cret\n")
        program("/usr/tavo/bin/tavoportforward", "echo syntax version=1")
        code, out, err = tool("router", "set", "--password-file", "-", stdin="n3w\nrest\n")
        self.assertEqual(code, OK, err)
        self.expect("router show --show-password", OK, "user +admin\npassword +n3w\n")
        # UPnP for a while: the account is put aside, and comes back by itself.
        self.expect("router set --upnp yes", OK, "stored as the settings")
        self.assertNotIn("n3w", get(ROUTER))
        self.assertEqual(os.stat(f"{CONF}/router_account.conf").st_mode & 0o777, 0o600)
        self.expect("router set --upnp no", OK, "stored as the settings")
        self.expect("router show --show-password", OK, "user +admin\npassword +n3w\nconnection +http, port 80")
        self.assertFalse(os.path.exists(f"{CONF}/router_account.conf"))
        self.expect("router set --upnp yes", OK, "stored as the settings")
        self.expect("router set --upnp no --conn-port 8080 --user other", USAGE, "no terminal to ask")
        code, _, err = tool("router", "set", "--upnp", "no", "--conn-port", "8080", "--password-file", "-", stdin="n4w\n")
        self.assertEqual(code, OK, err)
        self.expect("router show --show-password", OK, "user +admin\npassword +n4w\nconnection +http, port 8080")

    def test_a_password_that_is_not_given_after_all_leaves_the_terminal_as_it_was(self):
        known()
        before = get(ROUTER)
        pid, fd = pty.fork()
        if pid == 0:
            os.execv(TOOL, [TOOL, "router", "set", "--ask-password"])
        text = b""
        while b"account: " not in text:
            text += os.read(fd, 4096)
        echo = lambda: bool(termios.tcgetattr(fd)[3] & termios.ECHO)
        self.assertFalse(echo())
        os.kill(pid, signal.SIGINT)
        self.assertEqual(os.waitstatus_to_exitcode(os.waitpid(pid, 0)[1]), FAILED)
        self.assertTrue(echo())
        self.assertEqual(get(ROUTER), before)
        os.close(fd)

    # ---- router tests ---------------------------------------------------------------------------

    def test_verdicts_of_the_compatibility_test(self):
        whole = "10 20 30 60 40 50 70 80 90"
        for answer, code, pattern, failed, held in (
                (f"0 0 Zeta yes 32 {whole}", OK, "works(?s:.)*holds +32 rules\n(?s:.)*not recorded", None, 32),
                (f"0 0 Zeta yes 60 {whole}", OK, "60 rules at least, as many as were tried", None, 60),
                (f"0 0 - - 0 {whole}", OK, "nothing can be recorded of it", None, None),
                ("1 0 Zeta no -1 10 20 30", FAILED, "did not take the test mappings(?s:.)*router.log\n", "add", None),
                ("1 0 Zeta no -1 10 20 30 60", FAILED, "holds none of the mappings that it said yes to", "count", None),
                ("1 0 Zeta no -1 10 20 30 60 40", FAILED, "did not take the mappings away", "delete", None),
                ("1 18 - - 0 10 20 30 60 40 50", FAILED, "ports of deleted mappings are still open", "closed", None),
                (f"1 0 Zeta no -1 {whole[:-3]}", FAILED, "ports of its mappings stay closed", "open", None),
                ("-1 13 - - 0 10 20", FAILED, "no router answered that speaks UPnP", None, None),
                ("-1 2 - - 0 10", BUSY, "another port-forwarding operation", None, None)):
            self.expect("compat", code, pattern, LD_PRELOAD=STAND_IN, TAVO_COMPAT=answer)
            told = self.json("compat", LD_PRELOAD=STAND_IN, TAVO_COMPAT=answer)[1]
            self.assertEqual((told.get("failed_step"), told.get("max_rules"), told.get("recorded", False)),
                             (failed, held, False), answer)
        self.assertFalse(os.path.exists(f"{DATABASE}.user"))

    def test_what_a_test_found_is_recorded_on_request_and_saving_goes_by_it(self):
        known(brand="Zeta")
        passed = {"LD_PRELOAD": STAND_IN, "TAVO_COMPAT": "0 0 Zeta yes 1 10 90"}
        failed = {"LD_PRELOAD": STAND_IN, "TAVO_COMPAT": "1 0 Zeta no -1 10 30"}
        self.expect("compat --record", OK, "recorded: .*more than 1 rules is refused", **passed)
        tool("rules", "add", "--router-port", "80")
        tool("rules", "add", "--router-port", "81")
        self.expect("save", TOO_MANY, "holds 1 rule and there are 2")
        self.expect("compat --record", FAILED, "not recorded", **failed)
        self.expect("router show", OK, "holds +1 rules")
        self.expect("compat --yes", FAILED, "recorded: .*as unknown", **failed)
        self.assertIn('support="no"', get(f"{DATABASE}.user"))
        self.expect("compat --yes", OK, "database says that this router holds 1 rules", LD_PRELOAD=STAND_IN,
                    TAVO_COMPAT="0 0 Acme yes 7 10 90")
        for answer, recorded in ((b"y\n", True), (b"\n", False)):
            code, text = on_terminal("compat", typed=answer, **passed)
            self.assertEqual((code, text.index("every step passed") < text.index("Record it?"), "not recorded" in text),
                             (OK, True, not recorded))

    def test_a_signal_ends_a_test_that_hangs(self):
        for number in (signal.SIGINT, signal.SIGTERM):
            put("/tmp/upnp_test.progress", "upnp_add=\"processing\"\n")
            with subprocess.Popen([TOOL, "compat", "--yes"], text=True, stdout=subprocess.PIPE, stderr=subprocess.PIPE,
                                  env={**os.environ, "LD_PRELOAD": STAND_IN,
                                       "TAVO_COMPAT": "0 0 Zeta yes 9 10 20 30 hang"}) as run:
                self.assertIn("making test mappings", [run.stderr.readline() for _ in range(3)][2])
                run.send_signal(number)
                out, err = run.communicate(timeout=30)
            self.assertEqual((run.returncode, out), (FAILED, ""))
            self.assertIn("the test is stopped", err)
            self.assertFalse(os.path.exists("/tmp/upnp_test.progress"))
            self.assertFalse(os.path.exists(f"{DATABASE}.user"))

    def test_a_running_test_is_left_alone_until_it_is_told_to_stop(self):
        put("/tmp/upnp_test.progress", "upnp_add=\"failed\"\n")
        self.expect("compat --stop", OK, "no compatibility test has mappings")
        self.assertTrue(os.path.exists("/tmp/upnp_test.progress"))
        with subprocess.Popen(["/usr/tavo/sbin/upnpd --debug -p"], executable="/usr/bin/python3",
                              stdin=subprocess.PIPE) as daemon:  # waits for a program to run
            self.expect("compat", BUSY, "running already", LD_PRELOAD=STAND_IN, TAVO_COMPAT="0 0 Zeta yes 9 10")
            self.assertIsNone(daemon.poll())
            begin = time.monotonic()
            self.expect("compat --stop", OK, "the test is stopped")
            self.assertLess(time.monotonic() - begin, 5, "it waits for the end of the test, and no longer")
            self.assertEqual(daemon.wait(timeout=10), -signal.SIGHUP)

    def test_reachability_is_told_port_by_port_and_never_guessed(self):
        self.expect("test", OK, "no rule to test")
        tool("rules", "add", "web", "--router-port", "80,443", "--box-port", "8080,8443")
        tool("rules", "add", "dns", "--router-port", "53", "--protocol", "all")
        tool("rules", "add", "off", "--router-port", "99", "--disabled")
        self.saved()
        rows = [("1", "80", "8080", "tcp"), ("1", "443", "8443", "tcp"), ("2", "53", "53", "tcp"),
                ("2", "53", "53", "udp"), ("3", "99", "99", "tcp")]
        for answer, code, words in (("2 2 2 2 1", OK, ["came through"] * 4 + ["switched off"]),
                                    ("2 3 0 NOLISTEN 0 UNKNOWN 1", REFUSED,
                                     ["came through", "refused", "no program on this box", "nobody outside", "switched off"]),
                                    ("2 0 NOLISTEN 2 2 1", REFUSED, ["came", "no program on this box", "came", "came", "off"]),
                                    ("2 0 UNKNOWN 2 2 1", FAILED, ["came", "nobody outside", "came", "came", "off"])):
            environment = {"LD_PRELOAD": STAND_IN, "TAVO_REACH": answer}
            got, told = self.json("test", **environment)
            self.assertEqual(got, code)
            self.assertEqual([(port["rule"], port["router_ports"], port["box_ports"], port["protocol"])
                              for port in told["ports"]], rows)
            for port, word in zip(told["ports"], words):
                self.assertIn(word, port["reason"])
            self.expect("test", code, "1 web +443/tcp to 8443", **environment)
        # The library itself, with no checker named anywhere.
        self.expect("test 2 3", FAILED, r"2 dns +53/udp +not tested(?s:.)*tavoportcheckd(?s:.)*\[portcheck\]")
        put("/etc/tavo/platform.conf", '[portcheck]\nurl="http://127.0.0.1:1"\ntoken="0123456789abcdef"\n')
        self.expect("test 2", REFUSED, r"nobody listens on port 53 of this box\n(?s:.)*53/udp +not tested +the port checker cannot be reached"
                    r"(?!(?s:.)*tavoportcheckd)(?s:.)*warning: .*cannot be reached by IPv4; it is http://127.0.0.1:1, named as url")
        os.unlink("/etc/tavo/platform.conf")
        self.expect("test 7", USAGE, "there is no rule 7; the rules are 1, 2, 3")

    def test_a_report_says_what_it_lacks(self):
        files = ("/tmp/upnp_test.progress", "/var/tmp/upnp_portmap.status", "/var/log/router.log", "/tmp/pfStatusRule")
        known()
        settings = get(ROUTER)
        tested = {"LD_PRELOAD": STAND_IN, "TAVO_LAST": "1 Acme"}
        put("/tmp/written", "by root, in time\n")
        for i, kind in itertools.product(range(5), ("link", "other", "old")):  # no archive of ours
            planted = f"/tmp/{kind}_{int(time.time()) + i}.tgz"
            if kind == "old":
                put(planted, "x\n")
                os.utime(planted, (0, 0))
            else:
                (os.symlink if kind == "link" else os.link)("/tmp/written", planted)
        self.expect("report", FAILED, "'sudo tavoportmap detect' looks for it")
        self.expect("report", FAILED, "which this one is not(?s:.)*router.log", LD_PRELOAD=STAND_IN, TAVO_LAST="2 Acme")
        for path in files:
            if os.path.exists(path):
                os.unlink(path)
        self.expect("report", FAILED, "did not leave /tmp/upnp_test.progress, (?s:.)*router.log", **tested)
        for path in files:
            put(path, "x\n")
        program("/usr/tavo/bin/curl", "exit 22")
        self.expect("report", FAILED, r"no server is named(?s:.)*stays in /tmp/Acme_\d+\.tgz", **tested)
        program("/usr/tavo/bin/curl", "")
        told = self.json("report", **tested)[1]
        self.assertTrue(os.path.exists(told["archive"]), told)
        self.assertEqual(get(ROUTER), settings)

    def test_diagnostics_print_what_the_library_prints(self):
        put(RULES, '[1]\nenabled="1"\nprotocol name="tcp"\nr_port="80-81"\ns_port="80-81"\nservice="\\x1b[2J"\n')
        for arguments, code, pattern in (
                ("diag parse-ports 80,443,8000-8002", OK, "^80 443 8000 8001 8002\n$"),
                ("diag parse-ports 80,0", FAILED, "^80\n.*answered -1"),
                ("diag to-ports 1,2,3,7", OK, "^1-3, 7\n$"),
                ("diag to-ports 1,2,3,4,5,6,7,8,9,10,11", FAILED, "^out of range, i=10 MAX=10\n"),
                ("diag rules", OK, r"^\[0\]\nenable=1\n(?s:.)*router ports=80 ,81 \n(?s:.)*service name=\\x1b\[2J\n"),
                ("diag conflicts hoplink;5000-5001;tcp", OK, "^service name=hoplink\n(?s:.)*after delete(?s:.)*5000-5001"),
                ("diag conflicts hoplink;5000", FAILED, "szProtocol:NULL"),
                ("diag test hoplink;5000;tcp", OK, r"router_ports \[5000\]=not test\n"),
                ("diag set hoplink;5000;tcp", OK, r"router_ports \[5000\]=not test\n")):
            self.expect(arguments, code, pattern)
        self.assertEqual(self.json("diag", "to-ports", "1,2")[1]["output"], "1-2\n")

    # ---- status ---------------------------------------------------------------------------------

    def keep(self, on="upnp", alive=True, most=None):
        """Rules of one, two and no ports, the run key, and a process that counts as the daemon."""
        self.store((1, "tcp", "443", "8443", "web"), (1, "all", "53,5000-5001", "53,5000-5001", ""), (0, "tcp", "9", "9", "x"))
        put("/etc/tavoinfo.conf", f'runupnpportmapping="{"yes" if on == "upnp" else "no"}"\n'
                                  f'runnatpmpportmapping="{"yes" if on == "natpmp" else "no"}"\n')
        known(most=most)
        shutil.rmtree("/run/tavo", ignore_errors=True)
        os.makedirs("/run/tavo")
        if alive:
            daemon = subprocess.Popen([on + "d"], executable="/usr/bin/python3", stdin=subprocess.PIPE)
            self.addCleanup(lambda: (daemon.kill(), daemon.wait(), daemon.stdin.close()))
            return daemon.pid
        return 0

    def publish(self, pid, *refused, name="upnpd", **members):
        """All ports of those rules open, but for those named: (port, protocol, members)."""
        now = int(time.time())
        rows = [{"name": f"{port}/{protocol}", "router_port": port, "box_port": box, "protocol": protocol, "rule": rule,
                 "state": "open", "word": "1", "why": None, "holder": None, "since": now, "until": now + 3600}
                for port, box, protocol, rule in ((443, 8443, "tcp", "web"), (53, 53, "tcp", "8"), (53, 53, "udp", "8"),
                                                  (5000, 5000, "tcp", "8"), (5001, 5001, "tcp", "8"),
                                                  (5000, 5000, "udp", "8"), (5001, 5001, "udp", "8"))]
        for port, protocol, changes in refused:
            next(row for row in rows if (row["router_port"], row["protocol"]) == (port, protocol)).update(changes)
        put("/run/tavo/next", json.dumps({"protocol": "UPnP", "pid": pid, "at": now, "switched_on": True, "gateway": GATEWAY,
                                          "box": "192.168.77.2", "outside": "198.41.0.4", "router": "ok", "router_why": None,
                                          "router_since": now, "next_look": now + 120, "rules": rows, "left_over": [],
                                          **members}))
        os.rename("/run/tavo/next", f"/run/tavo/{name}.json")

    def standing(self, **environment):
        code, told = self.json("status", **environment)
        return code, told["standing"], [rule["state"] for rule in told["rules"]]

    def test_status_says_what_is_kept_and_what_keeps_it_from_being(self):
        shutil.rmtree("/run/tavo", ignore_errors=True)
        put("/etc/tavoinfo.conf", "")
        self.expect("status", OK, "kept by +nobody(?s:.)*tavoportmap open 443")
        self.keep(on="none", alive=False)
        self.expect("status", AWAY, "web +443/tcp to 8443 +not kept +mapping is switched off(?s:.)*'sudo tavoportmap save'")
        os.unlink(ROUTER)
        self.expect("status", AWAY, "nobody knows the router yet(?s:.)*'sudo tavoportmap setup'")
        self.keep(alive=False)
        self.expect("status", AWAY, "not kept +upnpd does not run\n(?s:.)*'sudo tavoportmap save' starts it")
        pid = self.keep()
        self.expect("status", FAILED, "unknown +upnpd has not said anything of it yet(?s:.)*look again")
        self.publish(pid)
        self.assertEqual(self.standing(), (OK, "in_force", ["open", "open", "off"]))
        self.expect("status", OK, "outside address +198.41.0.4\n(?s:.)*last look +.* s ago, next(?s:.)*all 2 rules are in force\n$")
        console = {"state": "refused", "word": "718", "why": "another device has this port on the router",
                   "holder": {"address": "192.168.77.7", "description": "console\x1b[2J"}}
        self.publish(pid, (443, "tcp", console), (5001, "udp", {"state": "waiting", "why": "taken", "until": 0}),
                     left_over=[{"name": "8080/tcp", "address": "192.168.77.9", "why": "its former address", "until": None}],
                     outside="100.64.3.4")
        self.assertEqual(self.standing(), (REFUSED, "partly", ["refused", "waiting", "off"]))
        self.expect("status", REFUSED,
                    r"the provider's own(?s:.)*7 web +443/tcp to 8443 +refused +another device .* \(192.168.77.7, console\\x1b\[2J\), since \d"
                    r"(?s:.)*\n8 +53,5000-5001/tcp, 53,5000/udp +open +since .*\n8 +5001/udp +waiting +taken, .*until 1970-01-01"
                    r"(?s:.)*\n9 x +9/tcp +off\n(?s:.)*8080/tcp +192.168.77.9 +its former address\n(?s:.)*2 of 2 rules are not in force")
        told = self.json("status")[1]
        self.assertEqual((told["rules"][0]["ports"][0]["holder"]["address"], told["outside"]["kind"]), ("192.168.77.7", "carrier"))
        # A rule that has been changed since the daemon looked is not taken for the one it saw.
        self.publish(pid, (443, "tcp", {"box_port": 8444}))
        self.assertEqual(self.standing(), (FAILED, "unknown", ["unknown", "open", "off"]))
        for word, why, code, pattern in (("unreachable", "nobody answers", AWAY, "nobody answers, since .* upnpd looks again at"),
                                         ("no_upnp", "switched off?", AWAY, "'sudo tavoportmap setup' looks for another way"),
                                         ("busy", "", OK, "all 2 rules")):
            self.publish(pid, router=word, router_why=why)
            self.expect("status", code, pattern)
        self.publish(pid, at=1, next_look=2)
        self.expect("status", FAILED, "has not looked at the router since 1970")
        put(ROUTER, (KNOWN % ("yes", "no")).replace(GATEWAY, "10.0.0.1"))
        self.publish(pid)
        self.expect("status", OK, "warning: the stored settings are those of the router 10.0.0.1, and the gateway is 192.168.77.1")
        with no_gateway():
            self.expect("status", AWAY, "no default gateway")
        tool("rules", "add", "new", "--router-port", "81")
        tool("rules", "remove", "7")
        self.expect("status", OK, r"10 new +81/tcp +new\n7 web +443/tcp to 8443 +removed\n(?s:.)*all 2 rules are in force"
                                  "(?s:.)*warning: .*'sudo tavoportmap save' puts them in force")
        self.assertEqual([rule["router_ports"] for rule in self.json("status")[1]["draft"]], ["53,5000-5001", "9", "81"])
        tool("rules", "discard")
        put(RULES, "")
        self.expect("status", OK, "no rules are in force")

    def test_status_says_what_the_service_manager_has_of_the_daemon(self):
        """The unit's state by systemctl, whether the daemon lives, and the words that tell of it."""
        program("/usr/bin/systemctl.new", "cat /tmp/unit")
        os.rename("/usr/bin/systemctl.new", "/usr/bin/systemctl")  # a real one is nobody's in a user's sandbox: only its place is ours
        os.makedirs("/run/systemd/system")
        self.addCleanup(shutil.rmtree, "/run/systemd")
        for state, alive, code, pattern in (
                ("loaded failed enabled signal", False, AWAY, r"its unit is failed, signal\); 'sudo journalctl -u upnpd' says"),
                ("loaded inactive enabled success", False, AWAY, r"its unit is inactive\);(?s:.)*restart upnpd' starts it"),
                ("not-found inactive - success", False, AWAY, "upnpd does not run; 'sudo tavoportmap save' starts it"),
                ("loaded active enabled success", True, OK, r"runs, unit active and enabled\)(?s:.)*in force\n$"),
                ("loaded active disabled success", True, OK, "disabled(?s:.)*in force\nwarning: .*'sudo systemctl enable upnpd'"),
                ("loaded inactive enabled success", True, OK, "in force\nwarning: .*outside of its unit.*restart upnpd' hands it")):
            put("/tmp/unit", "LoadState={}\nActiveState={}\nUnitFileState={}\nResult={}\n".format(*state.split()))
            self.publish(self.keep(alive=alive))
            self.expect("status", code, pattern)

    def test_the_man_page_names_each_member_of_the_status(self):
        self.publish(self.keep(), (443, "tcp", {"holder": {"address": "192.168.77.7", "description": "x"}}),
                     left_over=[{"name": "8080/tcp", "address": "192.168.77.9", "why": "x", "until": None}])
        tool("rules", "add", "new", "--router-port", "81")
        told = self.json("status", LD_PRELOAD=STAND_IN, TAVO_LAST="1 Acme")[1]
        page = get(f"{SOURCE}/docs/tavoportmap.1").replace("\\-", "-")
        page = page[page.index("the members are always there"):page.index(".SH EXIT STATUS")]
        heads = {word for line in re.findall(r"(?m)^\.TP\n(.*)", page) for word in re.findall(r"[a-z_0-9]{2,}", line)}
        self.assertEqual(told.keys() - {"ok", "message", "warnings"}, heads)
        words = {word for line in re.findall(r"(?m)^\.(?:B|BR|RB|IR) (.*)", page) for word in re.findall(r"[a-z_0-9]+", line)}
        for part in ("settings", "last_detection", "outside", "upnpd", "last_look"):
            self.assertLessEqual(told[part].keys(), words, part)
        port = told["rules"][0]["ports"][0]
        self.assertLessEqual({"state", "ports", *port, *port["holder"], *told["left_over"][0]}, words)

    def test_without_a_gateway_nothing_is_done_and_that_is_said(self):
        self.store((1, "tcp", "443", "8443", "web"))
        tool("rules", "add", "new", "--router-port", "81")
        before = get(RULES)
        with no_gateway():
            for command in ("close 443", "off", "save"):
                self.expect(command, AWAY, "no default gateway(?s:.)*\nNothing was changed", **WRITES)
            for command in ("setup", "detect", "open 80", "save --dry-run", "router set --upnp yes", "router show", "router table",
                            "compat --yes", "report", "service set hoplink 80/tcp", "service detect", "status"):
                self.expect(command, AWAY if command == "status" else FAILED, "no default gateway", **WRITES)
        self.assertEqual((get(RULES), os.path.exists(ROUTER), os.path.exists(OFF)), (before, False, False))
        self.assertEqual([row[3] for row in self.rows()], ["443", "81"], "the edit still waits")

    def test_status_of_a_router_that_is_driven_through_its_pages(self):
        self.keep(on="none", alive=False)
        known("no", "no")
        self.assertEqual(self.standing(), (FAILED, "unknown", ["unknown", "unknown", "off"]))
        self.publish(1, name="tavoportforward", protocol="pages")
        self.expect("status", OK, "all 2 rules are in force, as the router's pages took them at")
        self.expect("status --live", OK, "warning: what stands in a router's own pages is not read back")
        self.expect("router table", FAILED, "its table stands there, mostly at http://192.168.77.1/")
        self.publish(1, name="tavoportforward", protocol="pages", gateway="10.9.9.9")
        self.assertEqual(self.standing()[:2], (FAILED, "unknown"), "what another router took")

    def test_what_pages_forward_that_are_not_in_use_is_named(self):
        """By the program that keeps the record; where it knows no account any more it asks nobody."""
        program, reader, record = "/usr/tavo/bin/tavoportforward", "/usr/tavo/bin/tavopages", "/var/lib/tavo/pages_made.conf"
        row = '[{0} {2} {3}]\ngateway="{0}"\nhardware="{1}"\nprotocol="{2}"\nrouter_port="{3}"\nbox_port="{3}"\nmore="{4}"\nclient="192.168.77.2"\ntext="tavo:x"\nshown="no"\n'
        os.makedirs("/usr/tavo/bin", exist_ok=True)
        remove = lambda *paths: [os.path.lexists(path) and os.unlink(path) for path in paths]
        remove(program, reader)
        for path in (program, reader):
            os.symlink(f"{BUILD}/programs/tavoportforward", path)
        self.addCleanup(remove, program, reader, record, "/run/tavo/tavoportforward.json")
        put(DATABASE, '[Acme/R1/1]\nsupport="yes"\nmax="9"\n')
        why = "own pages forward it: take it away there \\(there are no settings for the pages of the router 192.168.77.1; .*upnp yes goes back\\)"
        for text, names in ((row.format(GATEWAY, "", "TCP", 443, 0) + row.format(GATEWAY, "", "BOTH", 7000, 4), ["7000-7004/both", "443/tcp"]),
                            (row.format("10.9.9.9", "", "TCP", 443, 0), []), ("", []), ("no record\n", [])):
            for on, settings, said in (("upnp", KNOWN % ("yes", "no"), names), ("natpmp", KNOWN % ("no", "yes"), names),
                                       ("none", KNOWN % ("no", "no"), []), ("none", "", names)):
                self.keep(on, alive=False)
                put(record, text)
                put(ROUTER, settings)
                self.publish(1, name="tavoportforward", protocol="pages", left_over=[])
                code, told = self.json("status")
                self.assertEqual([left["name"] for left in told["left_over"]], said)
                if said:
                    self.assertNotEqual(code, OK)
                    self.assertRegex(tool("status")[1], f"443/tcp +192.168.77.2 +.*{why}")
                    self.assertEqual(get(record), text, "to look changes nothing")
            for command, done in (("close web", "443/tcp closed"), ("off", "every port is closed")):
                self.keep(alive=False)
                put(record, text)
                code, told = self.json(*command.split(), **WRITES)
                self.assertEqual((code, [left["name"] for left in told.get("left_over", [])]), (REFUSED if names else OK, names), told)
                self.assertEqual(done in told["message"], not names, told)
                self.assertEqual("pages, which are not in use any more, still forward 7000-7004/both, 443/tcp" in told["message"], bool(names))
            code, told = self.json("status")
            self.assertEqual((code, "no rule asks for: 2 rows" in told["message"]),
                             (REFUSED, True) if names else (OK, False), "what 'off' did not close is no success")
        self.assertEqual(self.in_force()[0]["enabled"], False)
        put(record, row.format(GATEWAY, "", "TCP", 443, 0))
        remove(program)
        untold, named = ["what their record has"], ["443/tcp"]
        for script, mode, said in (("exit 1", 0o755, untold), (None, 0, untold), ("", 0o644, untold),  # an older run's word does not count
                                   (f"cat /proc/$$/comm /proc/$$/cmdline >/tmp/seen; exec {BUILD}/programs/tavoportforward $1", 0o755, named)):
            remove(reader)
            if script is not None:
                put(reader, f"#!/bin/sh\n{script}\n")
                os.chmod(reader, mode)
            self.keep(alive=False)
            self.publish(1, name="tavoportforward", protocol="pages", left_over=[], switched_on=False, at=1000)
            for command in ("off", "status"):
                code, told = self.json(command, **WRITES)
                self.assertEqual((code, [left["name"] for left in told.get("left_over", [])]), (REFUSED, said), told)
        self.assertNotIn("tavoportforward", get("/tmp/seen"), "nobody who asks what runs takes it for a save")
        self.assertIn("tavoportforward could not be run", self.json("off", **WRITES)[1]["message"])
        put(RULES, "no rules\n")
        code, told = self.json("off", **WRITES)
        self.assertEqual((code, [left["name"] for left in told["left_over"]]), (FAILED, named), told)
        self.assertRegex(told["message"], "cannot be read(?s:.)*still forward 443/tcp(?s:.)*'sudo tavoportmap off' tries again")

    def test_status_takes_nobodys_word_but_roots(self):
        path = "/run/tavo/upnpd.json"
        pid = self.keep()
        self.publish(pid)
        good = get(path)
        untold = (FAILED, "unknown", ["unknown", "unknown", "off"])
        for damage in (lambda: os.chmod(path, 0o666), lambda: os.chmod("/run/tavo", 0o777),
                       lambda: (os.rename(path, "/run/tavo/other"), os.symlink("other", path)),
                       lambda: (os.unlink(path), os.mkfifo(path)), lambda: (os.unlink(path), os.mkdir(path)),
                       lambda: put(path, ""), lambda: put(path, good[:-9]), lambda: put(path, "[" * 100000),
                       lambda: put(path, '["UPnP"]'), lambda: put(path, good + "{"), lambda: os.truncate(path, 1 << 30),
                       lambda: put(path, good.replace(f'"pid": {pid}', '"pid": 1')),
                       lambda: put(path, good.replace(f'"pid": {pid}', '"pid": -5')),
                       lambda: put(path, good.replace('"rules": [', '"rules": {"a":[').replace("]", "]}", 1)),
                       lambda: put(path, re.sub(r'"router_port": \d+', '"router_port": 99999999999999999999', good)),
                       lambda: put(path, re.sub(r'"(state|protocol)": "[^"]*"', r'"\1": ["open"]', good))):
            self.assertEqual(self.standing(), (OK, "in_force", ["open", "open", "off"]))
            damage()
            self.assertEqual(self.standing(), untold)
            shutil.rmtree("/run/tavo")
            os.mkdir("/run/tavo")
            put(path, good)

    def test_status_without_root(self):
        pid = self.keep()
        self.publish(pid, (443, "tcp", {"state": "refused", "why": "taken"}))
        user = ("setpriv", "--bounding-set=-dac_override,-dac_read_search")
        for path in (RULES, ROUTER):
            os.chmod(path, 0)
        for seen in (True, False):
            run = subprocess.run([*user, TOOL, "status"], text=True, capture_output=True, check=False)
            self.assertIn("run it with sudo", run.stdout)
            self.assertEqual(run.returncode, REFUSED if seen else FAILED, run.stderr)
            self.assertEqual(("web   443/tcp to 8443" in run.stdout, "refused  taken" in run.stdout), (seen, seen), run.stdout)
            os.unlink("/run/tavo/upnpd.json") if seen else None
        self.publish(pid)
        run = subprocess.run([*user, TOOL, "status"], text=True, capture_output=True, check=False)
        self.assertEqual(run.returncode, OK, run.stdout + run.stderr)
        self.assertIn("all 2 rules are in force", run.stdout)

    def test_status_asks_the_router_itself_when_it_is_told_to(self):
        self.publish(self.keep())
        other, mine = "TCP:443", "TCP:443@192.168.77.2:8443"
        rest = " TCP:53@192.168.77.2:53 UDP:53@192.168.77.2:53 TCP:5000@192.168.77.2:5000 TCP:5001@192.168.77.2:5001 " \
               "UDP:5000@192.168.77.2:5000 UDP:5001@192.168.77.2:5001 TCP:7@192.168.77.2:70"
        for table, code, pattern in ((mine + rest, OK, "7/tcp +70 +console(?s:.)*all 2 rules are in force"),
                                     (other + rest, REFUSED, r"web +443/tcp to 8443 +refused +another device .* \(192.168.77.99, console\\x1b"),
                                     ("TCP:443@192.168.77.2:1" + rest, REFUSED, "the router leads it to port 1 of this box"),
                                     (rest, REFUSED, "web .* waiting +it is not in the router's table now")):
            self.expect("status --live", code, pattern, LD_PRELOAD=STAND_IN, TAVO_USED=table)
        self.expect("status --live", AWAY, "no router answers by UPnP now", LD_PRELOAD=STAND_IN)
        self.expect("router table", OK, r"443/tcp +192.168.77.2:8443 +ours +for good(?s:.)*7/tcp +192.168.77.2:70 +this box(?s:.)*9/udp +192.168.77.99:0 +for good +console\\x1b",
                    LD_PRELOAD=STAND_IN, TAVO_USED=mine + rest + " UDP:9")
        self.expect("router table", AWAY, "no router answers by UPnP at 192.168.77.1", LD_PRELOAD=STAND_IN)
        self.publish(self.keep(on="natpmp"), name="natpmpd", protocol="NAT-PMP")
        self.expect("status --live", OK, "warning: a NAT-PMP router cannot be asked", LD_PRELOAD=STAND_IN)
        self.expect("router table", FAILED, "'tavoportmap status' shows what it granted", LD_PRELOAD=STAND_IN)

    def test_status_watches_until_it_is_stopped(self):
        pid = self.keep()
        self.publish(pid)
        for arguments, before, after in (((), "all 2 rules are in force", "443/tcp to 8443: refused, taken"),
                                         (("--json",), '"standing":"in_force"', '"standing":"partly"')):
            with subprocess.Popen(["timeout", "60", TOOL, "status", "--watch", *arguments], text=True,
                                  stdout=subprocess.PIPE) as run:
                while before not in (line := run.stdout.readline()):
                    self.assertTrue(line)
                self.publish(pid, (443, "tcp", {"state": "refused", "why": "taken"}))
                while after not in (line := run.stdout.readline()):
                    self.assertTrue(line)
                run.send_signal(signal.SIGINT)
                self.assertEqual(run.wait(timeout=10), REFUSED)
            self.publish(pid)

    def test_a_live_watch_asks_the_router_each_half_minute(self):
        self.publish(self.keep())
        world = {"LD_PRELOAD": STAND_IN, "TAVO_USED": "TCP:443@192.168.77.2:8443", "TAVO_HURRY": "1"}
        with subprocess.Popen([TOOL, "status", "--watch", "--live"], text=True, stdout=subprocess.DEVNULL,
                              stderr=subprocess.PIPE, env={**os.environ, **world}) as run:
            lines = (run.stderr.readline() for _ in range(200))
            next(line for line in lines if line.startswith("asked"))
            waited = sum(int(line.split()[0]) for line in itertools.takewhile(lambda line: "ms" in line, lines))
            run.send_signal(signal.SIGINT)
            self.assertEqual(run.wait(timeout=10), REFUSED)
        self.assertEqual(waited, 30000)

    def test_netcheck_says_what_each_check_found(self):
        """The five answers, the number of routers to look at, and the word of each check that then fails."""
        good = "eth0 0 192.168.77.1 0 0 1 0"
        for checks, arguments, failing, pattern in (
                (good, (), (), "3 hops(?s:.)*eth0 is up(?s:.)*192.168.77.1 is the default(?s:.)*a host outside answers"
                               "(?s:.)*1: only the home router(?s:.)*servers answer"),
                ("eth0 0 192.168.77.1 0 0 0 0", ("1",), (), "1 hops(?s:.)*0: this box has a public address"),
                ("eth0 0 192.168.77.1 0 0 2 0", ("30",), ("level",), "30 hops(?s:.)*2: a second router"),
                ("eth0 0 192.168.77.1 0 0 -1 0", (), ("level",), "neither the gateway nor"),
                ("eth0 -1 192.168.77.1 0 0 1 0", (), ("interface",), "eth0 is down"),
                ("- -1 - -1 0 1 0", (), ("interface", "gateway"), "no network interface(?s:.)*no default gateway"),
                ("eth0 0 192.168.77.1 -1 0 1 0", (), ("gateway",), "192.168.77.1 is in none of the networks"),
                ("eth0 0 192.168.77.1 0 -1 1 -1", (), ("outside", "names"), "no host outside(?s:.)*servers do not answer")):
            run = subprocess.run([NETCHECK, *arguments], text=True, capture_output=True, check=False,
                                 env={**os.environ, "LD_PRELOAD": STAND_IN, "TAVO_CHECKS": checks})
            self.assertRegex(run.stderr + run.stdout, pattern)
            self.assertEqual(run.returncode, FAILED if failing else OK, checks)
            self.assertEqual(re.findall(r"(?m)^(\w+) +(ok|FAIL) +\d\.\d\d s  \w", run.stdout),
                             [(name, "FAIL" if name in failing else "ok")
                              for name in ("interface", "gateway", "outside", "level", "names")])
        for arguments, code in ((("--help",), OK), (("0",), USAGE), (("31",), USAGE), (("x",), USAGE), (("3", "3"), USAGE)):
            run = subprocess.run([NETCHECK, *arguments], text=True, capture_output=True, check=False)
            self.assertEqual((run.returncode, (run.stderr if code else run.stdout)[:6]), (code, "Usage:"), arguments)

    def test_status_knows_a_detection_by_its_lock(self):
        self.keep(on="none", alive=False)
        for path in ("/tmp/upnp_detector.lock", "/tmp/natpmp_detector.lock"):
            with held(path):
                self.expect("status", AWAY, "running now +a detection(?s:.)*nothing is kept while a detection of the router goes on")
            other = "/run/other.lock"  # a lock of somebody else, on a file of the same number elsewhere
            put(other, "")
            while (ours := os.stat(path).st_ino) != (theirs := os.stat(other).st_ino):
                behind = path if ours < theirs else other
                os.unlink(behind)
                put(behind, "")
            with open(other, encoding="utf-8") as lock:
                fcntl.flock(lock, fcntl.LOCK_EX)
                self.assertEqual(self.json("status")[1]["running"], "idle", path)
        self.assertEqual(self.json("status")[1]["running"], "idle")

    # ---- relay services -------------------------------------------------------------------------

    def store(self, *rules):
        """rule.conf from (enabled, protocol, router ports, box ports, service)."""
        put(RULES, "".join(f'[{i}]\nenabled="{on:d}"\nprotocol name="{protocol}"\nr_port="{router}"\ns_port="{box}"\n'
                           f'service="{name}"\n' for i, (on, protocol, router, box, name) in enumerate(rules, 7)))

    def test_who_keeps_a_port(self):
        """Each case: rules of ours, the request, what stays out and why, or why all of it fails."""
        known(brand="Zeta", most=3)
        no_port = {}
        for rules, request, out, after, fails in (
                ((), "80/tcp 90-91/udp", no_port, ["80", "90-91"], None),
                (((1, "tcp", "80", "80", "web"),), "80-81/tcp", {"80/tcp": r"rule 7 \(web\) has it"}, ["80", "81"], None),
                (((1, "all", "80", "80", ""),), "80/tcp", {"80/tcp": "rule 7 has it"}, ["80"], None),
                (((1, "tcp", "80", "80", ""),), "80/all", no_port, ["80", "80"], None),
                (((1, "tcp", "8080", "80", ""),), "80/tcp", None, None, "half of what rule 7 forwards"),
                (((0, "tcp", "80,443", "80,443", "hoplink"),), "443/tcp 8080/tcp",
                 {"443/tcp": "rule 7 .* switches it off"}, ["443", "8080"], None),
                (((0, "tcp", "80", "80", "hoplink"),), "81/tcp", no_port, ["81"], None),
                (((0, "tcp", "80", "81", "hoplink"),), "81/tcp", None, None, "names one of the two"),
                (((1, "tcp", "80", "80", "hoplink"),), "81/tcp", no_port, ["81"], None),
                (((1, "tcp", "80,81", "80", "x"),), "82/tcp", no_port, ["80-81", "82"], None),
                ((), "5000/tcp 5000/udp 5000/all", {"5000/tcp": "another host", "5000/all": "another host"}, ["5000"], None),
                (((0, "tcp", "5000", "5000", "hoplink"),), "5000/tcp", {"5000/tcp": "switches it off"}, [], None),
                ((), "1/tcp 3/tcp 5/tcp 7/tcp", None, None, "holds 3 rules and there would be 4"),
                (((1, "tcp", "x", "80", ""),), "82/tcp", None, None, "rule 7 cannot be read")):
            self.store(*rules)
            code, told = self.json("service", "plan", "hoplink", *request.split(), LD_PRELOAD=STAND_IN,
                                   TAVO_USED="TCP:5000 UDP:53")
            self.assertEqual(code, FAILED if fails else OK, told)
            if fails:
                self.assertRegex(told["refusal"], fails)
                continue
            stay = {f"{port['ports']}/{port['protocol']}": port["why_not"] for port in told["requests"] if not port["opens"]}
            self.assertEqual(stay.keys(), out.keys(), (rules, request))
            for port, why in out.items():
                self.assertRegex(stay[port], why)
            self.assertEqual([rule["router_ports"] for rule in told["rules_after"]], after, (rules, request))

    def test_the_plan_is_what_the_library_does(self):
        dice = random.Random(7)
        span = lambda: dice.choice(["{0}", "{0}-{1}", "{0},{2}"]).format(*sorted(dice.sample(range(20, 29), 3)))
        protocol = lambda: dice.choice(["tcp", "tcp", "udp", "all"])
        outcomes = {}
        for turn in range(60):
            known(*(("yes", "no") if turn % 2 else ("no", "yes")), brand="Zeta", most=0)
            rules = []
            for _ in range(dice.randrange(4)):
                ports = span()
                rules.append((dice.randrange(2), protocol(), ports, ports if dice.random() < 0.6 else span(),
                              dice.choice(["hoplink", "web", ""])))
            self.store(*rules)
            request = [f"{span()}/{protocol()}" for _ in range(dice.randrange(1, 3))]
            world = {"LD_PRELOAD": STAND_IN, "TAVO_USED": "TCP:22 UDP:23 TCP:25", "TAVO_SAVE": "0 write"}
            before = self.rows()
            plan = self.json("service", "plan", "hoplink", *request, **world)[1]
            self.assertEqual(self.rows(), before)
            code, told = self.json("service", "set", "hoplink", *request, "--force", **world)
            case = (rules, request, plan, told)
            if plan["refusal"]:
                self.assertEqual((code, told["result"], self.rows()), (FAILED, -1, before), case)
            else:
                out = any(not port["opens"] for port in plan["requests"])
                self.assertEqual((code, told["result"]), (REFUSED if out else OK, 0), case)
                self.assertEqual(self.json("rules", "export")[1]["rules"], plan["rules_after"], case)
            outcomes[code] = outcomes.get(code, 0) + 1
        self.assertGreater(min(outcomes[OK], outcomes[REFUSED], outcomes[FAILED]), 5, outcomes)

    def test_answers_to_a_service(self):
        world = {"LD_PRELOAD": STAND_IN, "TAVO_USED": "TCP:9", "TAVO_SAVE": "0 write", "TAVO_REACH": "2 0 NOLISTEN"}
        for arguments, pattern in (("set hoplink 80", "'80' is no request: .*5000-5001/tcp"),
                                   ("set hoplink 80/tpc", "did you mean 'tcp'"), ("plan hoplink 0/tcp", "no request"),
                                   ("set hoplink", "ports is required"), ("clear", "service is required")):
            self.expect(f"service {arguments}", USAGE, pattern)
        self.expect("service set hoplink 80/tcp", FAILED, "not been detected yet: .*service detect", **world)
        self.expect("service plan hoplink 80/tcp", FAILED, "would fail: the router has not been detected", **world)
        known("no", "no")
        self.expect("service set hoplink 80/tcp", FAILED, "nothing was changed: .*own pages", **world)
        known(brand="Zeta")
        self.expect("service set hoplink 80/tcp", FAILED, "nobody has recorded how many rules", **world)
        put(DATABASE, '[Zeta/R1/1]\nsupport="yes"\nmax="9"\n')
        self.expect("service list", OK, "no rule belongs to a service")
        self.store((1, "tcp", "443", "8443", "web"))
        self.expect("service set hoplink 80/tcp 81/udp --test", REFUSED,
                    "80/tcp +ok(?s:.)*81/udp +not tested +no program(?s:.)*do not answer to the outside", **world)
        self.expect("service set hoplink 80/tcp 9/tcp", REFUSED, "9/tcp +stays out: another host(?s:.)*stay out", **world)
        self.expect("service list", OK, "hoplink +2 +enabled +tcp +80\n(?s:.)*web +1 ")
        self.assertEqual(self.json("service", "list")[1]["rules"][0]["service_id"], "HopLink")
        self.expect("service clear web", USAGE, "no service made it", **world)
        self.expect("service clear hoplnik", USAGE, "'hoplnik' has no rules(?s:.)*web, hoplink; did you mean 'hoplink'", **world)
        self.expect("service clear hoplink", OK, "keeps no port for this service", **world)
        self.assertEqual([row[1:] for row in self.rows()], [(True, "tcp", "443", "8443", "web")])
        self.expect("service set hoplink " + ",".join(map(str, range(30001, 30341, 2))) + "/tcp", USAGE, "lose its end", **world)
        self.expect("service set hoplink 80/tcp", FAILED, "stored, but the router did not take them all",
                    **{**world, "TAVO_SAVE": "-1 write"})
        self.expect("service set hoplink 81/tcp", FAILED, "service plan.* shows", **{**world, "TAVO_SAVE": "-1"})
        with held():
            for arguments in ("set hoplink 80/tcp", "clear hoplink", "detect", "plan hoplink 80/tcp"):
                self.expect(f"service {arguments}", BUSY, "another port-forwarding operation", **world)

    def test_a_service_has_the_router_classified(self):
        for detected, tested, code, pattern in (
                ("0 0 0 1 1 0 32 10 80", "", OK, "by UPnP or NAT-PMP"), ("0 0 0 1 1 0 32 10 child", "", OK, "by UPnP"),
                ("0 0 0 1 0 0 -1 10 80", "", OK, "its own pages"), ("-1 0 0 0 0 0 -1 10", "", FAILED, "'sudo tavoportmap detect' says"),
                ("0 0 0 1 2 0 -1 10 80", "0 0 Zeta yes 20 10 90", OK, "by UPnP"),
                ("0 0 0 1 2 0 -1 10 80", "1 0 Zeta no -1 10 30", OK, "its own pages")):
            self.setUp()
            world = {"LD_PRELOAD": STAND_IN, "TAVO_DETECT": detected, "TAVO_COMPAT": tested}
            got, out, err = tool("service", "detect", **world)
            self.assertEqual((got, len(re.findall(pattern, out + err))), (code, 1), (detected, tested, out, err))
            self.assertEqual(os.path.exists(f"{DATABASE}.user"), bool(tested))

    def test_what_listens_on_this_box(self):
        """Real sockets, a program of another name, and a port that the packet filter hands to a container."""
        with contextlib.ExitStack() as keep:
            for address, port in (("0.0.0.0", 7001), ("127.0.0.1", 7002), ("::", 7003), ("::1", 7004), ("::ffff:127.0.0.1", 7005),
                                  ("192.168.77.2", 7006)):
                bound(keep, address, port)
            bound(keep, "0.0.0.0", 7007, socket.SOCK_DGRAM)
            bound(keep, "127.0.0.1", 7008, socket.SOCK_DGRAM, ("127.0.0.1", 9))
            bound(keep, "127.0.0.1", 7009, peer=("127.0.0.1", 7002))
            carrier = "import socket; s=socket.create_server(('0.0.0.0', 7010)); print(1, flush=True); import sys; sys.stdin.read()"
            put("/proc/self/comm", "tester")
            put("/tmp/run.py", f"open('/proc/self/comm', 'w').write('docker-proxy')\n{carrier}\n")
            other = keep.enter_context(subprocess.Popen(["/usr/bin/python3", "/tmp/run.py"], stdin=subprocess.PIPE,
                                                        stdout=subprocess.PIPE, text=True))
            other.stdout.readline()
            for step in ("link add inner type veth peer name inner1", "addr add 172.29.0.1/24 dev inner",
                         "link set inner up", "link set inner1 up"):
                subprocess.run(["ip", *step.split()], check=True)
            subprocess.run(["nft", "-f", "-"], check=True, text=True, input="""table ip containers { chain in {
                type nat hook prerouting priority dstnat
                tcp dport { 7011, 7012-7013 } dnat to 172.29.0.2:80
                udp dport 7014 counter dnat to 172.29.0.2
                tcp dport != 7015 dnat to 172.29.0.2
                tcp dport 7016 dnat to 192.168.77.9
                tcp dport 7017 accept
                }
            }""")
            told = subprocess.run([f"{BUILD}/tests/cli/listeners"], capture_output=True, text=True, check=True).stdout
            other.stdin.close()
        self.assertEqual(told.splitlines(), [
            "tcp 7001 0.0.0.0 open tester", "tcp 7002 127.0.0.1 loopback tester", "tcp 7003 :: open tester",
            "tcp 7004 ::1 loopback tester", "tcp 7005 ::ffff:127.0.0.1 loopback tester",
            "tcp 7006 192.168.77.2 open tester", "tcp 7010 0.0.0.0 open docker-proxy(container)",
            *(f"tcp {port} 0.0.0.0 open (container)" for port in (7011, 7012, 7013)),
            "udp 7007 0.0.0.0 open tester", "udp 7014 0.0.0.0 open (container)"])

    def test_models(self):
        os.makedirs(MODELS)
        self.expect("routers", OK, "no router descriptions are installed.*README.md says how.; no server is named .*database_url")
        self.expect("routers --update", FAILED, "^error: no server is named to fetch descriptions from [^;]*\n$")
        for brand, model, version in (("Acme", "R1", "1.0"), ("Acme", "R2 Plus", "2.0"), ("Zeta", "Z", "1")):
            describe(brand, model, version)
        for search, models in (((), ["R1", "R2 Plus", "Z"]), (("ACME",), ["R1", "R2 Plus"]), (("plus", "acme"), ["R2 Plus"])):
            self.assertEqual([router["model"] for router in self.json("routers", *search)[1]["routers"]], models)
        self.expect("routers nothere", OK, "none of the 3 known routers matches")
        put("/etc/tavo/platform.conf", '[download]\ndatabase_url="http://127.0.0.1:1"\n[other]\n[download]\n')
        program("/usr/tavo/bin/wget", r"printf 'no\302\233route\342\200\256\n' >&2; exit 4")
        self.expect("routers --update", FAILED, r"could not be updated, and the old ones stay: no\\u\{9b\}route\\u\{202e\}\n")
        os.unlink("/etc/tavo/platform.conf")

    def test_models_of_the_owner(self):
        own = "/etc/tavo/routerdb"
        for path, text in (("Acme/R1/1.0/router.des", "mine"), ("Mine/M/generic", 'version="7"\n'), ("Mine/M/7/router.des", "")):
            put(f"{own}/{path}", text)
        describe("Acme", "R1", "1.0")
        known = lambda: [(m["brand"], m["version"], m["generic"]) for m in self.json("routers")[1]["routers"]]
        self.assertEqual(known(), [("Acme", "1.0", False), ("Mine", "7", True), ("Mine", "7", False)])
        self.assertEqual(get(f"{MODELS}/Mine/M/7/router.des"), "", "where the library looks")
        shutil.rmtree(own)
        self.assertEqual(known(), [("Acme", "1.0", False)])


if __name__ == "__main__":
    for number in (signal.SIGHUP, signal.SIGINT, signal.SIGTERM):  # whoever starts this may ignore them
        signal.signal(number, signal.default_int_handler if number == signal.SIGINT else signal.SIG_DFL)
    os.makedirs(CONF, exist_ok=True)
    for step in ("link add box type veth peer name router", "addr add 192.168.77.2/24 dev box", "link set box up",
                 "link set router up", f"route add default via {GATEWAY}"):
        subprocess.run(["ip", *step.split()], check=True)
    unittest.main()
