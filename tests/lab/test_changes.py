"""What changes behind the box's back, and where a user is told of it: system log, event log, hooks, published state."""
import json
import os
import re
import shutil
import signal
import socket
import subprocess
import threading
import time
import unittest
from urllib.parse import quote

import homelab
from homelab import BUILD, GATEWAY, HERE, LAN2, PUBLIC, sh, wait_for

LAB = None
JOURNAL = []  # (priority, program, text)
HOOKS, RAN = "/etc/tavo/hooks.d", "/tmp/hooks"
EVENT_LOG = "/var/log/tavo/event.log"
WARNING, NOTICE = 28, 29  # of a daemon
OK, REFUSED, AWAY = 0, 4, 6  # exit codes of the status
EVENTS = {"port-lost": (WARNING, "0x13100030", "Lost on the router", REFUSED),
          "port-refused": (WARNING, "0x13100031", "Refused by the router", REFUSED),
          "port-back": (NOTICE, "0x13100032", "Open on the router now", OK),
          "router-gone": (WARNING, "0x13100033", "The router is gone", AWAY),
          "router-back": (NOTICE, "0x13100034", "The router is back", OK),
          "router-replaced": (NOTICE, "0x13100035", "The router is another one", OK),
          "address-changed": (NOTICE, "0x13100036", "The outside address has changed", OK),
          "renewed": (NOTICE, "0x13100037", "The router had lost these ports, and has them again", OK)}
HOSTILE = "con'sole\";$(touch /tmp/harm)`touch /tmp/harm`"
PORT = "5001/tcp (service 1)"
GATEWAY_URL = f"http://{GATEWAY}:5000"


def listen_to_syslog():
    """A /dev of our own, where /dev/log is ours."""
    os.makedirs("/tmp/dev")
    for name in ("null", "zero", "full", "random", "urandom"):
        sh(f"touch /tmp/dev/{name} && mount --bind /dev/{name} /tmp/dev/{name}")
    sh("ln -s /proc/self/fd /tmp/dev/fd && mount --rbind /tmp/dev /dev")
    log = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
    log.bind("/dev/log")

    def listen():
        while True:
            line = log.recv(8192).decode(errors="replace")
            match = re.fullmatch(r"<(\d+)>\w+ +\d+ [\d:]+ ([\w-]+)(?:\[\d+\])?: (.*)\n?\0?", line, re.DOTALL)
            JOURNAL.append((int(match[1]), match[2], match[3]))

    threading.Thread(target=listen, daemon=True).start()


def published(daemon="upnpd"):
    """What the daemon knows; None when it says nothing."""
    try:
        return json.loads(LAB.read(f"/run/tavo/{daemon}.json"))
    except FileNotFoundError:
        return None


def router_word(daemon="upnpd"):
    return (published(daemon) or {}).get("router")


def row(name="5001/tcp", daemon="upnpd"):
    return next((row for row in (published(daemon) or {"rules": []})["rules"] if row["name"] == name), None)


def hook(name, text, mode=0o755):
    os.makedirs(HOOKS, mode=0o755, exist_ok=True)
    LAB.write(f"{HOOKS}/{name}", text)
    os.chmod(f"{HOOKS}/{name}", mode)


def hooked():
    """What the hook has found in its environment, once for each time that it ran."""
    runs = []
    for name in sorted(os.listdir(RAN), key=int) if os.path.exists(RAN) else []:
        runs.append(dict(line.split("=", 1) for line in LAB.read(f"{RAN}/{name}").split("\0") if line))
    return runs


class Story(unittest.TestCase):
    daemon = "upnpd"

    def setUp(self):
        LAB.install(natpmp=self.daemon == "natpmpd")
        LAB.settings(check_interval=1)
        os.makedirs(RAN, exist_ok=True)
        hook("write-down", f"#!/bin/sh\nn=$(($(ls {RAN} | wc -l) + 1))\nenv -0 >/tmp/run && mv /tmp/run {RAN}/$n\n")

    def save(self, *rules):
        answer = LAB.save(*(rules or ("1,1,tcp,5001,5001",)))
        wait_for(lambda: published(self.daemon), 5, "the state is published")
        return answer

    def kernel_told(self):
        """The news in the system log, as (event, text)."""
        return [(event, text.split(": ", 1)[1]) for priority, program, text in JOURNAL if program == self.daemon
                for event, (wanted, _, head, _) in EVENTS.items() if text.startswith(head) and priority == wanted]

    def told(self, *news, seconds=60):
        """Exactly this has been told so far, as (event, pattern of the text), and the same everywhere."""
        wait_for(lambda: len(self.kernel_told()) >= len(news), seconds, f"{news} told, not {JOURNAL}")
        there = self.kernel_told()
        self.assertEqual([event for event, _ in there], [event for event, _ in news], JOURNAL)
        for (_, text), (event, pattern) in zip(there, news):
            self.assertRegex(text, f"^{pattern}$", event)
        wait_for(lambda: len(hooked()) >= len(news), 10, "the hooks have run")
        self.assertEqual([(run["TAVO_EVENT"], run["TAVO_TEXT"].split(": ", 1)[1]) for run in hooked()], there)
        lines = LAB.read(EVENT_LOG).splitlines() if os.path.exists(EVENT_LOG) else []
        lines = [line for line in lines if " 0x1310003" in line]
        self.assertEqual(len(lines), len(there), lines)
        for line, (event, text) in zip(lines, there):
            priority, number, head, _ = EVENTS[event]
            self.assertIn(f"{'warning' if priority == WARNING else 'info'} {number} {head}: {text}", line)
        facts = hooked()[-1] if there else {}
        self.status(EVENTS[there[-1][0]][3] if there else OK, facts.get("TAVO_WHY", ""))
        return facts

    def status(self, code, why=""):
        """What the tool's user is told at this moment, and with which exit code."""
        def asked():
            done = LAB.run("box", f"{BUILD}/cli/tavoportmap status", check=False)
            said.append(f"{done.returncode}: {done.stdout}{done.stderr}")
            return done.returncode == code and why in " ".join(said[-1].split())
        said = []
        try:
            wait_for(asked, 10, f"status answers {code} and says {why!r}")
        except AssertionError as error:
            raise AssertionError(f"{error}, not {said[-1]}") from None


class ScriptedRouter(Story):
    def setUp(self):
        super().setUp()
        LAB.start_scripted("none")
        self.assertEqual(self.save()["status"], 0)

    def tell_router(self, what):
        LAB.run("box", f"curl -s '{GATEWAY_URL}/{what}'")

    def test_another_device_takes_the_port_and_gives_it_back(self):
        self.tell_router(f"take?5001,{LAN2},{quote(HOSTILE)}")
        lost = ("port-lost", f"{re.escape(PORT)}: another device has this port on the router, {LAN2} "
                             f"\\({re.escape(HOSTILE)}\\)")
        facts = self.told(lost)
        self.assertEqual({name: facts[f"TAVO_{name}"] for name in (
            "DAEMON", "GATEWAY", "OUTSIDE", "PORT", "PROTOCOL", "BOX_PORT", "RULE", "WHY", "HOLDER",
            "HOLDER_DESCRIPTION")},
            {"DAEMON": "upnpd", "GATEWAY": GATEWAY, "OUTSIDE": PUBLIC, "PORT": "5001", "PROTOCOL": "tcp",
             "BOX_PORT": "5001", "RULE": "service 1", "WHY": "another device has this port on the router",
             "HOLDER": LAN2, "HOLDER_DESCRIPTION": HOSTILE})
        self.assertEqual(set(facts) - {name for name in facts if name.startswith("TAVO_")}, {"PATH", "PWD"})
        self.assertEqual((row()["state"], row()["word"], row()["holder"]),
                         ("refused", "718", {"address": LAN2, "description": HOSTILE}))
        since = row()["since"]
        LAB.stop_daemon(signal.SIGKILL)  # a restart tells nothing again
        wait_for(lambda: LAB.start("box", "/usr/tavo/sbin/upnpd").wait(10) == 0, 10, "the daemon is back")
        wait_for(lambda: published()["pid"] == LAB.daemon_pid(), 10, "it has looked")
        self.told(lost)
        self.assertEqual(row()["since"], since)
        self.tell_router("take?5001")
        self.told(lost, ("port-back", re.escape(PORT)))
        self.assertEqual(row()["state"], "open")
        self.assertFalse(os.path.exists("/tmp/harm"))

    def test_the_outside_address_changes(self):
        self.assertEqual(published()["outside"], PUBLIC)
        self.tell_router("outside?0.0.0.0")
        wait_for(lambda: published()["outside"] is None, 20, "there is none for a while")
        self.tell_router("outside?198.41.0.99")
        facts = self.told(("address-changed", f"198.41.0.99, before {PUBLIC}"))
        self.assertEqual((facts["TAVO_OUTSIDE"], facts["TAVO_OUTSIDE_BEFORE"]), ("198.41.0.99", PUBLIC))
        self.assertEqual(published()["outside"], "198.41.0.99")

    def test_what_the_user_does_himself_is_no_news(self):
        self.save("1,1,tcp,5001,5002", "2,1,tcp,5003,5003")
        self.save("1,0,tcp,5001,5002", "2,1,tcp,5003,5003")
        self.assertEqual([row["name"] for row in published()["rules"]], ["5003/tcp"])
        LAB.stop_daemon(signal.SIGTERM)
        self.assertIsNone(published())
        self.assertEqual(LAB.save("2,1,tcp,5003,5003")["status"], 0)
        wait_for(lambda: row("5003/tcp")["state"] == "open", 5, "open again")
        self.save("2,0,tcp,5003,5003")
        wait_for(lambda: published()["rules"] == [], 5, "all is closed")
        self.told()


class RealRouter(Story):
    gone = ("router-gone", f"{GATEWAY}: the router does not map ports by UPnP; it may be switched off in its settings")
    back = ("router-back", f"{GATEWAY} answers by UPnP")
    renewed = ("renewed", re.escape(PORT))

    def setUp(self):
        super().setUp()
        LAB.start_router()
        self.assertEqual(self.save()["status"], 0)

    def test_upnp_is_switched_off_and_on(self):
        LAB.reboot_router(upnp=False)
        self.assertEqual(self.told(self.gone)["TAVO_WHY"], self.gone[1].split(": ", 1)[1])
        self.assertEqual((router_word(), row()["state"], row()["word"]), ("no_upnp", "unknown", "noigd"))
        LAB.reboot_router()
        self.told(self.gone, self.back, self.renewed)
        self.assertEqual((router_word(), row()["state"]), ("ok", "open"))

    def test_the_router_is_silent_and_speaks_again(self):
        os.kill(LAB.router.pid, signal.SIGSTOP)
        silent = ("router-gone", f"{GATEWAY}: the router does not answer by UPnP")
        self.told(silent)
        self.assertEqual((router_word(), row()["state"]), ("silent", "unknown"))
        os.kill(LAB.router.pid, signal.SIGCONT)
        self.told(silent, self.back)

    def test_the_cable_is_out_and_in(self):
        LAB.run("router", "ip link set box1 down")
        gone = ("router-gone", f"{GATEWAY}: the network cable is out, or the network is down")
        self.told(gone)
        self.assertEqual(router_word(), "unreachable")
        LAB.run("router", "ip link set box1 up")
        self.told(gone, self.back)

    def test_the_router_is_unplugged(self):
        LAB.run("router", "ip link set br0 down")
        gone = ("router-gone", f"{GATEWAY}: nobody answers at the router's address")
        self.told(gone)
        self.assertEqual(router_word(), "unreachable")

    def test_no_gateway_any_more(self):
        LAB.run("box", "ip route del default")
        gone = ("router-gone", "this box has no default gateway")
        self.told(gone)
        self.assertEqual((router_word(), row()["word"], published()["gateway"]), ("no_gateway", "nogateway", None))

    def test_the_router_restarts_between_two_looks(self):
        before = row()["since"]
        LAB.reboot_router(port=5555)
        self.told(self.renewed)
        self.assertGreaterEqual(before, row()["since"])

    def test_the_router_is_replaced_by_another_device(self):
        LAB.stop_router()
        LAB.run("router", "ip link set br0 address 02:00:00:00:00:99")
        LAB.start_router()
        self.told(("router-replaced", f"another device answers at {GATEWAY}, with the hardware address "
                                      "02:00:00:00:00:99, before .*"), self.renewed)

    def test_the_daemon_is_killed(self):
        pid = LAB.daemon_pid()
        os.kill(pid, signal.SIGKILL)
        wait_for(lambda: published()["pid"] not in (pid, 0) and row()["state"] == "open", 20, "it is back")
        self.told()
        LAB.stop_daemon(signal.SIGKILL)
        self.assertEqual((row()["state"], LAB.daemon_pid()), ("open", 0))  # as it was when it last looked
        self.status(AWAY)


class Natpmp(Story):
    daemon = "natpmpd"

    def test_the_lease_is_asked_for_again_after_an_outage(self):
        gateway = LAB.start("router", "/usr/bin/python3", f"{HERE}/scripted_natpmp.py", "none")
        wait_for(lambda: os.path.exists("/tmp/natpmp_gateway.json"), 10, "the gateway is up")
        self.assertEqual(self.save()["status"], 0)
        gateway.send_signal(signal.SIGSTOP)
        gone = ("router-gone", f"{GATEWAY}: the router does not answer by NAT-PMP")
        self.told(gone)
        self.assertEqual((router_word("natpmpd"), row(daemon="natpmpd")["state"]), ("silent", "unknown"))
        LAB.end(gateway)
        LAB.start("router", "/usr/bin/python3", f"{HERE}/scripted_natpmp.py", "none")
        self.told(gone, ("router-back", f"{GATEWAY} answers by NAT-PMP"), ("renewed", re.escape(PORT)))
        self.assertEqual((router_word("natpmpd"), row(daemon="natpmpd")["state"]), ("ok", "open"))


class Hooks(unittest.TestCase):
    """Which files are run, how, and that nothing waits for them."""

    def setUp(self):
        LAB.install()
        LAB.settings(check_interval=1)

    @staticmethod
    def try_hooks(*facts):
        return subprocess.run(["/usr/tavo/bin/tavohook", "--try", *facts], capture_output=True, text=True, check=False)

    def test_only_what_is_roots_alone_is_run(self):
        said = "#!/bin/sh\necho \"$0 $TAVO_PORT\" >>/tmp/ran\nls /proc/self/fd | tr '\\n' ' ' >>/tmp/ran\n"
        hook("10-good", said)
        hook("20-good", said)
        hook("15-fails", "#!/bin/sh\necho 'no mail\nhost' >&2\nexit 3\n")
        hook("README.txt", said)
        hook("30-open", said, 0o775)
        hook("40-plain", said, 0o644)
        os.symlink(f"{HOOKS}/10-good", f"{HOOKS}/50-link")
        os.mkdir(f"{HOOKS}/60-directory")
        os.mkfifo(f"{HOOKS}/70-pipe")
        done = self.try_hooks("TAVO_PORT=5001")
        self.assertEqual(LAB.read("/tmp/ran"), "".join(f"{HOOKS}/{n}-good 5001\n0 1 2 3 " for n in (10, 20)))
        self.assertEqual(done.returncode, 1)
        for line in ("hook 15-fails: ended with 3: no mail host", f"not run: {HOOKS}/30-open: others than root may change it",
                     f"not run: {HOOKS}/40-plain: it is not executable", f"not run: {HOOKS}/50-link: it is a link",
                     f"not run: {HOOKS}/60-directory: it is no plain file", f"not run: {HOOKS}/70-pipe: it is no plain file"):
            self.assertIn(line, done.stderr)
        self.assertNotIn("README", done.stderr)
        os.chmod(HOOKS, 0o777)
        self.assertIn(f"{HOOKS}: others than root may change it", self.try_hooks().stderr)
        self.assertEqual(len(LAB.read("/tmp/ran").splitlines()), 3)

    def test_that_none_was_run_is_said(self):
        shutil.rmtree(HOOKS, ignore_errors=True)
        for facts, status, why in (((), 1, "there is no hook in /etc/tavo/hooks.d"), (("TAVO_PORT",), 2, "Usage"),
                                   (("=1",), 2, "Usage")):
            done = self.try_hooks(*facts)
            self.assertEqual((done.returncode, why in done.stderr), (status, True), done.stderr)
        hook("push.sh", "#!/bin/sh\n")
        self.assertRegex(self.try_hooks().stderr, "there is no hook .*NAME.sh")
        os.unlink(f"{HOOKS}/push.sh")
        hook("push", "#!/bin/sh\n")
        self.assertEqual(self.try_hooks().returncode, 0)

    def test_the_examples_pass_hostile_texts_on_as_texts(self):
        for program in ("/usr/local/bin/curl", "/usr/sbin/sendmail"):
            LAB.write(program, "#!/bin/sh\n{ printf '%s|' \"${0##*/}\" \"$@\"; cat; echo; } >>/tmp/called\n")
            os.chmod(program, 0o755)
        for name in ("mail", "push", "dynamic-dns"):
            hook(name, LAB.read(f"{HERE}/../../packaging/hooks.d/{name}"))
        text = f"@/etc/passwd {HOSTILE}"
        self.assertEqual(self.try_hooks("TAVO_EVENT=port-lost", f"TAVO_TEXT={text}").returncode, 0)
        mail, push = LAB.read("/tmp/called").split("curl|")
        self.assertTrue(mail.startswith("sendmail|-i|root|To: root\nSubject: ") and mail.endswith(f"\n\n{text}\n\n"), mail)
        self.assertIn(f"|--data-raw|{text}|https://push.example/", push)
        os.unlink(f"{HOOKS}/mail")
        for outside, status in (("203.0.113.5", 0), ("1.2.3.4&host=x", 1), ("", 1)):
            os.unlink("/tmp/called")
            done = self.try_hooks("TAVO_EVENT=address-changed", f"TAVO_OUTSIDE={outside}")
            self.assertEqual((done.returncode, os.path.exists("/tmp/called")), (status, status == 0), done.stderr)
            self.assertTrue(status or 'myip=203.0.113.5|user = "me:secret"' in LAB.read("/tmp/called"))
            LAB.write("/tmp/called", "")
        self.assertFalse(os.path.exists("/tmp/harm"))

    def test_a_hook_ends_with_the_runner(self):
        hook("10-hangs", "#!/bin/sh\necho $$ >/tmp/hanging\nexec sleep 1000\n")
        with subprocess.Popen(["/usr/tavo/bin/tavohook", "--try"], stderr=subprocess.PIPE, text=True) as runner:
            pid = int(wait_for(lambda: os.path.exists("/tmp/hanging") and LAB.read("/tmp/hanging"), 10, "the hook runs"))
            runner.terminate()
            self.assertIn("told to end", runner.communicate(timeout=10)[1])
        self.assertFalse(os.path.exists(f"/proc/{pid}"))
        os.unlink("/tmp/hanging")
        os.unlink(f"{HOOKS}/10-hangs")

    def test_a_hook_that_hangs_holds_up_neither_passes_nor_a_stop_and_is_ended(self):
        hook("10-hangs", "#!/bin/sh\necho $$ >/tmp/hanging\ntrap '' TERM\nsleep 1000 & echo $! >>/tmp/hanging\nwait\n"
                         "while :; do sleep 1; done\n")
        hook("20-next", "#!/bin/sh\necho \"$TAVO_EVENT\" >>/tmp/next\n")
        LAB.start_scripted("none")
        LAB.save("1,1,tcp,5001,5001")
        LAB.run("box", f"curl -s '{GATEWAY_URL}/take?5001,{LAN2},x'")
        pids = wait_for(lambda: os.path.exists("/tmp/hanging") and LAB.read("/tmp/hanging").split()[1:] and
                        LAB.read("/tmp/hanging").split(), 10, "the hook hangs")
        LAB.run("box", f"curl -s '{GATEWAY_URL}/take?5001'")
        wait_for(lambda: row()["state"] == "open", 5, "passes go on")
        begin = time.monotonic()
        LAB.stop_daemon(signal.SIGTERM)
        self.assertLess(time.monotonic() - begin, 5)
        wait_for(lambda: not any(os.path.exists(f"/proc/{pid}") for pid in pids), 45, "the hook is ended")
        wait_for(lambda: os.path.exists("/tmp/next"), 10, "the next one runs")
        self.assertEqual(LAB.read("/tmp/next"), "port-lost\n")


def prepare(lab):
    listen_to_syslog()
    lab.serve(5001, 5002, 5003, 5004)


if __name__ == "__main__":
    homelab.run_tests(prepare)
