"""The report of a compatibility test that failed, to a server that wants a password."""
import glob
import hashlib
import json
import os
import shutil
import signal
import tarfile
import unittest

import homelab
import test_compat
from homelab import GATEWAY, HERE, WAN, wait_for

LAB = None
PORT, HANGING_PORT = 8080, 8081
PLACE = "/tmp/reports"
ACCOUNTS = "/tmp/report.accounts"
USER, PASSWORD = "tavoreportuser", "rtrsubmit417"
MEMBERS = ["etc/portforward/router.conf", *(path[1:] for path in test_compat.FILES)]
SERVER = f"""
server.modules = ("mod_auth", "mod_authn_file", "mod_setenv", "mod_cgi")
server.document-root = "{HERE}"
server.port = {PORT}
server.upload-dirs = ("/tmp")
server.errorlog = "/tmp/report_server.log"
auth.backend = "htdigest"
auth.backend.htdigest.userfile = "{ACCOUNTS}"
auth.require = ("/" => ("method" => "digest", "algorithm" => "MD5", "realm" => "reports", "require" => "valid-user"))
setenv.add-environment = ("REPORT_PLACE" => "{PLACE}")
cgi.assign = (".cgi" => "/usr/bin/python3")
"""
HANGS = f"import socket, time; s = socket.create_server(('', {HANGING_PORT})); time.sleep(600)"


def compat(*arguments, seconds=120):
    return test_compat.start(*arguments).wait(seconds)


def accept(password):
    secret = hashlib.md5(f"{USER}:reports:{password}".encode()).hexdigest()
    LAB.write(ACCOUNTS, f"{USER}:reports:{secret}\n")


def send_to(port, page="report_server.cgi"):
    LAB.write("/etc/tavo/platform.conf", f'[report]\nserver="http://{WAN}:{port}/{page}"\n')


class Report(unittest.TestCase):
    def setUp(self):
        LAB.install()
        LAB.clear_state(*test_compat.FILES, test_compat.USER_DB, *glob.glob("/tmp/*.tgz"))
        shutil.rmtree(PLACE, ignore_errors=True)
        os.makedirs(PLACE)
        wrapper = LAB.read(f"{HERE}/../../packaging/curl")
        self.assertIn("--max-time 60 ", wrapper)
        LAB.write("/usr/tavo/bin/curl", wrapper.replace("--max-time 60 ", "--max-time 3 "))
        os.chmod("/usr/tavo/bin/curl", 0o755)
        accept(PASSWORD)
        send_to(PORT)

    def tearDown(self):
        LAB.stop_daemon(signal.SIGKILL)
        for pid in test_compat.test_daemon():
            os.kill(pid, signal.SIGKILL)
        LAB.end(LAB.router)
        LAB.clear_state(test_compat.USER_DB)

    def pretend_a_test(self):
        for path in test_compat.FILES:
            LAB.write(path, 'a="b"\n')

    def report(self, sent):
        """Sends one; the name of its archive. The settings are as before, whatever came of it."""
        settings = LAB.read("/etc/portforward/router.conf")
        for path in glob.glob("/tmp/*.tgz"):
            os.unlink(path)
        self.assertEqual(compat("report"), 0 if sent else 1)
        self.assertEqual(LAB.read("/etc/portforward/router.conf"), settings)
        self.assertEqual([name for name in os.listdir("/etc/portforward") if name.startswith("router.conf")],
                         ["router.conf"])
        self.assertEqual(os.path.exists(f"{PLACE}/report.tgz"), sent)
        name, = glob.glob("/tmp/*.tgz")
        return name

    def received(self, name):
        """The members of what has arrived, which is what the archive of that name holds."""
        arrived = json.loads(LAB.read(f"{PLACE}/report.json"))
        self.assertEqual(arrived["user"], USER)
        self.assertEqual(arrived["head"][0],
                         f'Content-Disposition: form-data; name="uploadedfile"; filename="{name}"')
        with open(name, "rb") as archive, open(f"{PLACE}/report.tgz", "rb") as file:
            self.assertEqual(archive.read(), file.read())
        with tarfile.open(f"{PLACE}/report.tgz", "r:gz") as tar:
            self.assertEqual(tar.getnames(), MEMBERS)
            return [tar.extractfile(member).read().decode() for member in MEMBERS]

    def check_report_of(self, step):
        name = self.report(True)
        self.assertRegex(name, r"^/tmp/Lab_\d+\.tgz$")
        settings, progress, _, log, _ = self.received(name)
        self.assertIn(f'{step}="failed"\n', progress)
        self.assertIn("=====init upnp start=====", log)
        self.assertEqual(settings.count("["), 1)
        for line in (f"[{GATEWAY}]", 'brand="Lab"', 'model="Scripted"', 'version="7"', 'support_router_upnp="yes"'):
            self.assertIn(line + "\n", settings)

    def test_a_step_that_fails(self):
        LAB.start_scripted("keeps_nothing")
        self.assertEqual(compat("known"), 0)
        self.assertEqual(test_compat.run(5, "test")["result"], 1)
        self.check_report_of("upnp_add")

    def test_a_test_daemon_that_is_killed(self):
        LAB.start_scripted("none")
        self.assertEqual(compat("known"), 0)
        for step, failed in (("upnp_delete", "upnp_connection_failed"), ("upnp_readd2", "upnp_connection_success")):
            with self.subTest(failed=failed):
                shutil.rmtree(PLACE)
                os.makedirs(PLACE)
                LAB.clear_state(*test_compat.FILES)
                caller = test_compat.start("test", 5)
                wait_for(lambda: os.path.exists(test_compat.FILES[0]) and
                         f'{step}="finished"' in LAB.read(test_compat.FILES[0]), 40, f"{step} is done")
                for pid in test_compat.test_daemon():
                    os.kill(pid, signal.SIGKILL)
                self.assertEqual(json.loads(caller.communicate(timeout=40)[0])["result"], 1)
                self.check_report_of(failed)

    def test_servers_that_do_not_take_it(self):
        LAB.start_scripted("none")
        self.assertEqual(compat("known"), 0)
        self.pretend_a_test()
        LAB.start("wan", "/usr/bin/python3", "-c", HANGS)
        wait_for(lambda: LAB.run("wan", f"ss -Hltn sport = :{HANGING_PORT}").stdout, 10, "the hanging server is up")
        for what, change in (("wrong password", lambda: accept("another")),
                             ("no such page", lambda: (accept(PASSWORD), send_to(PORT, "nothing"))),
                             ("away", lambda: send_to(9)), ("hangs", lambda: send_to(HANGING_PORT))):
            with self.subTest(what=what):
                change()
                name = self.report(False)
                with tarfile.open(name) as tar:
                    self.assertEqual(tar.getnames(), MEMBERS)
        send_to(PORT)
        self.received(self.report(True))


def prepare(lab):
    lab.write("/tmp/report_server.conf", SERVER)
    lab.start("wan", "/usr/sbin/lighttpd", "-D", "-f", "/tmp/report_server.conf")
    wait_for(lambda: lab.run("wan", f"ss -Hltn sport = :{PORT}").stdout, 10, "the server is up")


if __name__ == "__main__":
    homelab.run_tests(prepare)
