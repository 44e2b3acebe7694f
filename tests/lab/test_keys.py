"""The daemons' run keys after saves and detections that came to nothing: whatever was refused, failed or was killed,
a daemon that is started again brings the ports back. Each case is told by the tool as a person would type it."""
import contextlib
import fcntl
import os
import signal
import subprocess
import time
import unittest

import homelab
import networks
from homelab import BOX, GATEWAY, TOOL, sh, wait_for

LAB = OUTSIDE = None
KEYS, RECORD = "/etc/tavoinfo.conf", "/var/lib/tavo/run_keys.conf"
RULES, DATABASE = "/etc/portforward/rule.conf", "/etc/portforward/router_upnp.db"
OPEN = {("tcp", 5001): (BOX, 5001)}
FAILED, REFUSED, TOO_MANY, AWAY = 1, 4, 5, 6
SEVERAL = "".join(f'[{i}]\nenabled="1"\nprotocol name="tcp"\nr_port="{5000 + i}"\ns_port="{5000 + i}"\n'
                  for i in (1, 2))


def tool(command, **kwargs):
    return LAB.run("box", f"{TOOL} {command}", check=False, **kwargs)


def keys():
    """(upnp, natpmp), as a daemon reads them."""
    text = LAB.read(KEYS) if os.path.exists(KEYS) else ""
    return tuple(f'{key}="yes"' in text for key in ("runupnpportmapping", "runnatpmpportmapping"))


def is_free():
    """Whether nobody holds the router lock."""
    with open("/tmp/routerconf.lock", "a", encoding="ascii") as file:
        try:
            fcntl.flock(file, fcntl.LOCK_EX | fcntl.LOCK_NB)
            return True
        except OSError:
            return False


@contextlib.contextmanager


def little_space(path):
    """The directory with what it holds, on a file system that is full."""
    copy = subprocess.run(["tar", "-cC", path, "."], check=False, capture_output=True).stdout  # not what nobody may read
    def mount(size):
        subprocess.run(["mount", "-t", "tmpfs", "-o", f"size={size}", "tmpfs", path], check=True)
        subprocess.run(["tar", "--no-same-owner", "-xC", path], input=copy, check=True)
    mount("64m")
    used = sh(f"df --output=used -k {path}").stdout.split()[1]
    sh(f"umount {path}")
    mount(f"{used}k")
    try:
        yield
    finally:
        sh(f"umount {path}")


class Keys(unittest.TestCase):
    def setUp(self):
        LAB.install()
        OUTSIDE.settings()
        LAB.start_router()

    def tearDown(self):
        LAB.stop_daemon(signal.SIGKILL)
        LAB.stop_router()
        LAB.clear_state(KEYS, RECORD)

    def save(self, daemon="upnpd"):
        wait_for(is_free, 10, "the child of a killed detection has ended")
        self.assertEqual(LAB.save("1,1,tcp,5001,5001")["status"], 0)
        self.assertEqual(LAB.mappings(), OPEN)
        self.assertEqual(keys(), (daemon == "upnpd", daemon == "natpmpd"))
        self.assertFalse(os.path.exists(RECORD))

    def restart(self, daemon="upnpd"):
        """The box's daemon ends in whatever way and is started again, as at a boot."""
        LAB.stop_daemon(signal.SIGTERM)
        self.assertEqual(LAB.start("box", f"/usr/tavo/sbin/{daemon}").wait(10), 0)
        try:
            wait_for(lambda: OPEN.items() <= LAB.mappings().items() and not os.path.exists(RECORD), 30, "open again")
        except AssertionError:
            self.fail(f"not open again: {LAB.mappings()}, {keys()}, {os.path.exists(RECORD) and LAB.read(RECORD)}")

    def test_after_an_operation_that_fails(self):
        for name, way, prepare, command, code in (
                ("too many rules", "upnpd", lambda: LAB.write(DATABASE, '[Lab/One/1]\nmax="1"\n'), "save", TOO_MANY),
                ("too many for a service", "upnpd", lambda: LAB.write(DATABASE, '[Lab/One/1]\nsupport="yes"\nmax="1"\n'),
                 "service set relay 5002/tcp", TOO_MANY),
                ("no limit known", "upnpd", lambda: LAB.write(DATABASE, ""), "save", FAILED),
                ("another gateway's settings", "upnpd", self.other_gateway, "save", FAILED),
                ("no daemon", "upnpd", self.no_daemon, "save", AWAY),
                ("no daemon for a service", "upnpd", self.no_daemon, "service set relay 5002/tcp", FAILED),
                ("the router restarts during a detection", "upnpd", LAB.stop_router, "detect", None),
                ("a NAT-PMP router set by hand", "natpmpd", lambda: None, "detect", None),
                ("the same for a service", "natpmpd", lambda: None, "service detect", None)):
            with self.subTest(name):
                LAB.install(natpmp=way == "natpmpd")
                self.save(way)
                if "many" in name:
                    LAB.write(RULES, SEVERAL)
                prepare()
                run = tool(command)
                if code is not None:
                    self.assertEqual(run.returncode, code, run.stdout + run.stderr)
                LAB.install(natpmp=way == "natpmpd")
                if LAB.router is None:
                    LAB.start_router()
                self.restart(way)
                self.tearDown()
                self.setUp()

    @staticmethod
    def other_gateway():
        LAB.write("/etc/portforward/router.conf", LAB.read("/etc/portforward/router.conf").replace(GATEWAY, "10.9.9.9"))

    @staticmethod
    def no_daemon():
        LAB.stop_daemon(signal.SIGKILL)
        os.unlink("/usr/tavo/sbin/upnpd")

    def test_on_a_full_disk(self):
        for place in ("/var/lib/tavo", "/etc/portforward", "/etc"):
            with self.subTest(place):
                self.save()
                before = LAB.read(KEYS)
                with little_space(place):
                    run = tool("save")
                    self.assertEqual(run.returncode, FAILED, run.stdout + run.stderr)
                    self.assertIn("full", run.stderr)
                    self.assertEqual(LAB.read(KEYS), before)
                self.restart()

    def test_after_a_kill_at_any_moment(self):
        killed = 0
        for command, moments in (("save", (0, 0.01, 0.02, 0.03, 0.05, 0.08)), ("detect", (0.2, 1, "off")),
                                 ("service set relay 5002/tcp", (0.02, 0.05))):
            for moment in moments:
                with self.subTest(command=command, moment=moment):
                    self.save()
                    LAB.stop_router()
                    run = LAB.start("box", TOOL, *command.split(), stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
                    with contextlib.suppress(AssertionError):
                        wait_for(lambda: os.path.exists(RECORD) or run.poll() is not None, 10, "it has begun")
                    if moment == "off":
                        wait_for(lambda: keys() == (False, False), 30, "it has switched the daemon off")
                    else:
                        time.sleep(moment)
                    killed += run.poll() is None
                    LAB.end(run)
                    LAB.start_router()
                    if "service" in command:
                        LAB.write(RULES, SEVERAL.split("[2]")[0])
                    self.restart()
        self.assertGreater(killed, 5)

    def test_a_living_daemon_is_told(self):
        """Also where the lock of saves is none that it could trust."""
        self.save()
        os.unlink("/tmp/routerconf.lock")
        os.symlink("/tmp/elsewhere", "/tmp/routerconf.lock")
        self.addCleanup(os.unlink, "/tmp/routerconf.lock")
        LAB.settings(check_interval=1)
        LAB.stop_daemon(signal.SIGTERM)
        LAB.start("box", "/usr/tavo/sbin/upnpd").wait(10)
        with subprocess.Popen(["/usr/bin/sleep", "60"]) as dead:
            dead.kill()
        LAB.write(KEYS, 'runupnpportmapping="no"\n')
        self.note(dead.pid)
        os.kill(LAB.daemon_pid(), signal.SIGHUP)
        wait_for(lambda: not os.path.exists(RECORD) and keys() == (True, False), 10, "it mends what the dead one left")
        self.assertEqual(LAB.mappings(), OPEN)

    def test_what_is_off_on_purpose_stays_off(self):
        """(pid, what else is noted, the record's owner's doing): none of it switches anything on."""
        with subprocess.Popen(["/usr/bin/sleep", "60"]) as dead:
            dead.kill()
        def linked():
            self.note(dead.pid)
            os.rename(RECORD, f"{RECORD}.old")
            os.symlink(f"{RECORD}.old", RECORD)
        def writable():
            self.note(dead.pid)
            os.chmod(RECORD, 0o666)
        def switched_off():
            self.note(dead.pid)
            LAB.write(KEYS, LAB.read(KEYS))  # word for word as it was: his doing all the same
        for name, make in (("nothing noted", lambda: None),
                           ("noted off", lambda: self.note(dead.pid, upnp="no")),
                           ("somebody who lives", lambda: self.note(os.getpid(), alive=True)),
                           ("a link", linked), ("for others to write", writable),
                           ("garbage", lambda: LAB.write(RECORD, "\0\1[keys]\nupnp=\"yes\"\n")),
                           ("another word", lambda: self.note(dead.pid, extra='more="1"\n')),
                           ("another router's settings since", lambda: self.note(dead.pid, router="absent")),
                           ("switched off by somebody else since", switched_off),
                           ("a directory", lambda: os.makedirs(RECORD))):
            with self.subTest(name):
                LAB.write(RULES, SEVERAL)
                LAB.write(KEYS, 'runupnpportmapping="no"\nrunnatpmpportmapping="no"\n')
                make()
                self.assertEqual(LAB.start("box", "/usr/tavo/sbin/upnpd").wait(10), 0)
                wait_for(lambda: os.path.exists(homelab.STATUS), 10, "the first pass has ended")
                self.assertEqual((keys(), LAB.mappings()), ((False, False), {}))
                LAB.stop_daemon(signal.SIGKILL)
                if os.path.isdir(RECORD):
                    os.rmdir(RECORD)
                LAB.clear_state(RECORD, homelab.STATUS, KEYS)

    @staticmethod
    def note(pid, alive=False, upnp="yes", router=None, extra=""):
        """A record as the tool writes it."""
        def identity(path):
            status = os.stat(path)
            nano = status.st_mtime_ns
            return f"{status.st_ino}/{status.st_size}/{nano // 10**9}.{nano % 10**9}"
        start = LAB.read(f"/proc/{pid}/stat").rsplit(") ", 1)[1].split()[19] if alive else "1"
        os.makedirs(os.path.dirname(RECORD), exist_ok=True)
        LAB.write(RECORD, f'[keys]\npid="{pid}"\nstart="{start}"\n'
                          f'boot="{LAB.read("/proc/sys/kernel/random/boot_id").strip()}"\nnatpmp="no"\nupnp="{upnp}"\n'
                          f'rules="{identity(RULES)}"\n'
                          f'router="{router or identity("/etc/portforward/router.conf")}"\nsystem="{identity(KEYS)}"\n'
                          f'{extra}\n')


if __name__ == "__main__":
    def prepare(lab):
        global OUTSIDE  # pylint: disable=global-statement
        OUTSIDE = networks.Outside(lab)
        lab.serve(5001)
    homelab.run_tests(prepare)
