"""A daemon outside any service manager: started again after a crash, handed over, stopped whatever state it is in."""
import contextlib
import fcntl
import os
import re
import signal
import subprocess
import time

import homelab
from homelab import BOX, HERE, wait_for

LAB = None
DAEMON = "/usr/tavo/sbin/upnpd"
MAPPED = {("tcp", 5001): (BOX, 5001)}


def option(*options):
    return LAB.run("box", " ".join((DAEMON, *options)), check=False).returncode


class Daemon(homelab.Case):
    def setUp(self):
        LAB.install()
        LAB.start_router()
        self.assertEqual(LAB.save("1,1,tcp,5001,5001")["result"], 0)
        self.assertEqual(LAB.mappings(), MAPPED)

    def crash(self):
        pid = LAB.daemon_pid()
        os.kill(pid, signal.SIGKILL)
        wait_for(lambda: not os.path.exists(f"/proc/{pid}"), 5, "it has crashed")
        return pid

    def only_daemon(self):
        """The one process that goes by the daemon's name, which is the one that the pid file names."""
        pids = LAB.processes_of(DAEMON)
        return pids == [LAB.daemon_pid()] and pids[0]

    def test_a_crash_is_followed_by_a_new_start(self):
        old = self.crash()
        self.assertEqual(LAB.processes_of(DAEMON), [])  # the parent that waits is not taken for the daemon
        new = wait_for(self.only_daemon, 10, "it runs again")
        self.assertNotEqual(new, old)
        LAB.reboot_router()
        os.kill(new, signal.SIGHUP)
        wait_for(lambda: LAB.mappings() == MAPPED, 20, "it works as before")
        self.crash()
        self.assertEqual(LAB.save("1,1,tcp,5001,5001")["result"], 0)  # a request does not wait for the pause
        self.assertTrue(self.only_daemon())

    def test_a_hand_over_leaves_the_mappings_and_a_second_start_nothing_at_all(self):
        self.assertEqual(option(), 1)
        self.assertEqual(option("--foreground"), 1)
        old = self.only_daemon()
        changes = LAB.start("router", "nft", "monitor", stdout=subprocess.PIPE, text=True)
        new = LAB.start("box", DAEMON, "--foreground", "--take-over")
        wait_for(lambda: LAB.daemon_pid() == new.pid, 10, "the new one has taken over")
        wait_for(lambda: not (os.path.exists(f"/proc/{old}") or LAB.watcher()), 5, "the old one and its parent are gone")
        self.assertEqual(LAB.save("1,1,tcp,5001,5001")["result"], 0)
        self.assertEqual(LAB.daemon_pid(), new.pid)
        self.assertEqual(option("--hand-over"), 0)
        self.assertEqual(new.wait(), 0)
        LAB.end(changes)
        self.assertNotIn("delete rule", changes.stdout.read())
        self.assertEqual(LAB.mappings(), MAPPED)
        self.assertFalse(os.path.exists("/var/run/upnpd.pid"))

    def test_a_start_makes_the_lock_files_whatever_stands_in_their_places(self):
        LAB.stop_daemon(signal.SIGKILL)
        locks = re.findall(r"^f (\S+) 0600 root root", LAB.read(f"{HERE}/../../packaging/tmpfiles.conf"), re.M)
        def held(path):
            LAB.write(path, "")
            os.chmod(path, 0o666)
            self.held = open(path, encoding="ascii")  # pylint: disable=consider-using-with
            self.addCleanup(self.held.close)
            fcntl.flock(self.held, fcntl.LOCK_EX)
        for path, plant in zip(locks, (lambda path: os.symlink("/tmp/victim", path), os.mkfifo,
                                       lambda path: os.makedirs(f"{path}/full"), held), strict=True):
            with contextlib.suppress(FileNotFoundError):
                os.unlink(path)
            plant(path)
        self.assertEqual(option(), 0)
        self.assertFalse(os.path.exists("/tmp/victim"))
        self.assertEqual([os.lstat(path).st_mode for path in locks], [0o100600] * 4)
        self.assertEqual([name for name in os.listdir("/tmp") if ".lock." in name and
                          not os.path.isdir(f"/tmp/{name}/full")], [])
        with open(locks[3], encoding="ascii") as file:
            fcntl.flock(file, fcntl.LOCK_EX | fcntl.LOCK_NB)
        inodes = [os.stat(path).st_ino for path in locks]
        LAB.stop_daemon(signal.SIGKILL)
        self.assertEqual(option(), 0)
        self.assertEqual([os.stat(path).st_ino for path in locks], inodes, "ours stay, as somebody may hold them")

    def test_a_stop_says_when_the_router_could_not_be_asked(self):
        self.assertEqual(LAB.save("1,1,tcp,5001,5001")["result"], 0)
        LAB.stop_daemon(signal.SIGKILL)
        LAB.stop_router()
        run = LAB.run("box", f"{DAEMON} --stop", check=False)
        LAB.start_router()
        self.assertEqual(run.returncode, 1)
        self.assertIn("it may keep them", run.stderr)

    def test_a_stop_says_what_the_one_that_ran_has_left(self):
        for fault, asleep, left in (("gives_nothing_back", None, 1), ("none", lambda: LAB.router.pid, 1),
                                    ("none", LAB.daemon_pid, 0)):
            with self.subTest(fault=fault, left=left):
                self.tearDown()
                LAB.start_scripted(fault)
                LAB.save("1,1,tcp,5001,5001")
                self.assertEqual(LAB.status()["5001/tcp"], "1")
                if asleep is not None:
                    os.kill(asleep(), signal.SIGSTOP)
                stop = LAB.start("box", DAEMON, "--stop", stderr=subprocess.PIPE, text=True)
                if not left:
                    time.sleep(0.5)
                    self.crash()  # in the middle of its stop
                said = stop.communicate(timeout=15)[1]
                self.assertEqual(("it may keep them" in said, stop.returncode), (left, left))
                self.assertEqual((LAB.processes_of(DAEMON), LAB.watcher()), ([], 0))
                os.kill(LAB.router.pid, signal.SIGCONT)
                self.assertEqual(sum(row[1] == 5001 for row in LAB.scripted()["table"]), left)

    def test_a_stop_takes_the_mappings_away_whatever_is_left_to_stop(self):
        for before in (lambda: None, self.crash, lambda: os.kill(LAB.watcher(), signal.SIGKILL),
                       lambda: LAB.stop_daemon(signal.SIGKILL)):
            with self.subTest(before=before):
                self.assertEqual(LAB.save("1,1,tcp,5001,5001")["result"], 0)
                before()
                self.assertEqual(LAB.mappings(), MAPPED)
                self.assertEqual(option("--stop"), 0)
                self.assertEqual((LAB.mappings(), LAB.processes_of(DAEMON), LAB.watcher()), ({}, [], 0))
                self.assertFalse(os.path.exists("/var/run/upnpd.pid"))


if __name__ == "__main__":
    homelab.run_tests(lambda _: None)
