"""The two databases, fetched from a real server; whatever the server does, a database is whole or the old one."""
import glob
import io
import os
import shutil
import signal
import subprocess
import tarfile
import time
import unittest

from homelab import BUILD, HERE, WAN, run_tests, wait_for

LAB = None
SERVED = "/tmp/served"
ROUTERDB, OWN = "/etc.defaults/portforward/routerdb", "/etc/tavo/routerdb"
UPNP, VERSION = "/etc/portforward/router_upnp.db", "/etc/portforward/routersdk_version"
SCRIPTS = f"{HERE}/../../scripts"


def update(what):
    """(result, version) of the library's own call, made on the box."""
    script = (f"import ctypes; lib = ctypes.CDLL('{BUILD}/src/libtavoportmap.so'); n = ctypes.c_int(-1); "
              f"f = getattr(lib, '{what}'); f.restype = ctypes.c_bool; print(int(f(ctypes.byref(n))), n.value)")
    out = LAB.run("box", f'/usr/bin/python3 -c "{script}"')
    return tuple(map(int, out.stdout.split()))


def update_models():
    return update("TLibUpdateRouterDBList")


def update_in_words():
    out = LAB.run("box", f"{BUILD}/cli/tavoportmap routers --update", check=False)
    return out.stdout + out.stderr


def update_upnp():
    return update("_ZN12RouterUpnpDB6UpdateERi")


def tree(directory):
    return {path[len(directory):]: LAB.read(path) for path in glob.glob(f"{directory}/**", recursive=True)
            if os.path.isfile(path)}


def archive(*members):
    """An archive of (name, text, type, link target), with a good version file in front."""
    out = io.BytesIO()
    with tarfile.open(fileobj=out, mode="w:gz") as tar:
        for name, text, kind, link in (("version", b'version="666"\n', tarfile.REGTYPE, ""), *members):
            info = tarfile.TarInfo(name)
            info.size, info.type, info.linkname = len(text), kind, link
            tar.addfile(info, io.BytesIO(text))
    return out.getvalue()


def kill_tree(pid):
    """The process and what it has started, without a chance to tidy up."""
    with open(f"/proc/{pid}/task/{pid}/children", encoding="ascii") as file:
        below = file.read().split()
    os.kill(pid, signal.SIGKILL)
    for child in below:
        kill_tree(int(child))


class Downloads(unittest.TestCase):
    def setUp(self):
        LAB.install()
        for directory in (SERVED, ROUTERDB, OWN):
            shutil.rmtree(directory, ignore_errors=True)
        shutil.copytree(f"{HERE}/../../packaging/routerdb", "/tmp/edition", dirs_exist_ok=True)
        LAB.write("/tmp/edition/version", 'version="41"\n')
        LAB.run("box", f"{SCRIPTS}/make-routerdb /tmp/edition {SERVED} {HERE}/../../packaging/router_upnp.db")
        os.makedirs(f"{ROUTERDB}/Old/Model/1")
        LAB.write(f"{ROUTERDB}/version", 'version="3"\n')
        LAB.write(UPNP, '[Old/Model/1]\nsupport="yes"\n')
        LAB.write(VERSION, 'version="0"\n')
        shutil.copy(f"{HERE}/../../packaging/wget", "/usr/tavo/bin/wget")
        self.old = tree(ROUTERDB), tree("/etc/portforward")

    def serve_from(self, fault, port=8000):
        LAB.write("/etc/tavo/platform.conf", f'[download]\ndatabase_url="http://{WAN}:{port}/{fault}"\n')

    def pack(self, version, syntax=1):
        """An edition with one model, served."""
        with open(f"{SERVED}/routerdb.tgz", "wb") as file:
            file.write(archive(("version", f'version="{version}"\n'.encode(), tarfile.REGTYPE, ""), (
                "A/B/1/router.des", f'[global]\nsyntax version="{syntax}"\n'.encode(), tarfile.REGTYPE, "")))

    def unchanged(self, *but):
        left = [{k: v for k, v in files.items() if k not in but} for files in (tree(ROUTERDB), tree("/etc/portforward"))]
        self.assertEqual(left, [{k: v for k, v in files.items() if k not in but} for files in self.old])
        self.assertEqual(glob.glob(f"{ROUTERDB}.*"), [], "nothing is left beside it")

    def test_both_are_refreshed(self):
        self.serve_from("good")
        self.assertEqual(update_models(), (1, 41))
        wanted = {name: text for name, text in tree("/tmp/edition").items() if name != "/README.md"}
        self.assertEqual(tree(ROUTERDB), wanted)
        self.assertEqual(update_upnp(), (1, 1))
        self.assertEqual(LAB.read(UPNP), LAB.read(f"{HERE}/../../packaging/router_upnp.db"))

    def test_editions_that_the_box_cannot_use(self):
        self.serve_from("good")
        for version, syntax, why in ((4, 2, "needs syntax version 2"), (2, 1, "edition 2 is older than the installed 3")):
            self.pack(version, syntax)
            self.assertIn(why, update_in_words())
            self.unchanged()

    def test_what_the_owner_wrote_survives_a_refresh(self):
        os.makedirs(f"{OWN}/Mine/M/1")
        os.makedirs(f"{OWN}/A/B/1")
        for model, text in (("Mine/M", "[a]\n"), ("A/B", "[mine]\n")):
            LAB.write(f"{OWN}/{model}/1/router.des", text)
        self.pack(4)
        self.serve_from("good")
        self.assertIn("version 4", update_in_words())
        self.assertEqual(LAB.read(f"{ROUTERDB}/Mine/M/1/router.des"), "[a]\n")
        self.assertEqual([LAB.read(f"{place}/A/B/1/router.des") for place in (OWN, ROUTERDB)],
                         ["[mine]\n", '[global]\nsyntax version="1"\n'])

    def test_no_server_is_no_attempt(self):
        LAB.write("/etc/tavo/platform.conf", "")
        os.unlink(UPNP)
        os.makedirs("/usr/share/tavo", exist_ok=True)
        shutil.copy(f"{HERE}/../../packaging/routersdk_version", "/usr/share/tavo")
        start = time.monotonic()
        os.unlink(VERSION)
        self.assertEqual((update_upnp(), update_models()), ((1, 1), (1, 3)))
        self.assertLess(time.monotonic() - start, 3)
        self.assertEqual(LAB.read(UPNP), "", "nor is it looked for again")

    def test_a_server_with_faults(self):
        both = (update_models, update_upnp)
        for fault, calls, seconds, why in (
                ("half", both, 10, "came to nothing|cut|closed"), ("missing", both, 10, "answered 404"),
                ("portal", both, 10, "web page"), ("endless", both, 60, "64 MiB"), ("stalls", both[1:], 60, ""),
                ("dead", both, 10, "refused")):
            with self.subTest(fault=fault):
                self.serve_from(fault, 8001 if fault == "dead" else 8000)
                for call in calls:
                    start = time.monotonic()
                    self.assertEqual(call()[0], 0)
                    self.assertLess(time.monotonic() - start, seconds)
                self.unchanged()
                if why:
                    self.assertRegex(update_in_words(), f"{WAN}:800./{fault}/routerdb.tgz: .*({why})")

    def test_one_that_is_killed_leaves_the_old_file_and_nothing_for_good(self):
        for name, fault in (("router_upnp.db", "stalls"), ("router_upnp.db", "endless"), ("routersdk_version", "stalls")):
            with self.subTest(name=name, fault=fault):
                begun = f"/etc/portforward/{name}.download.*"
                sh = LAB.start("box", "/usr/tavo/bin/wget", f"http://{WAN}:8000/{fault}/{name}", "-O",
                               f"/etc/portforward/{name}")
                wait_for(lambda: any(os.path.getsize(path) >= (fault == "endless") for path in glob.glob(begun)
                                     if not path.endswith(".why")) and glob.glob(f"{begun}.why"), 10, "it has begun")
                kill_tree(sh.pid)
                sh.wait()
                left = glob.glob("/etc/portforward/*.download.*")
                self.unchanged(*(path[len("/etc/portforward"):] for path in left))
                for path in left:
                    os.utime(path, (0, 0))
        self.serve_from("good")
        self.assertEqual(update_upnp(), (1, 1))
        self.assertEqual(glob.glob("/etc/portforward/*.download.*"), [])

    def test_archives_that_mean_harm(self):
        LAB.write("/tmp/victim", "untouched")
        text = b"harm"
        table = (("parent", [("../../../../tmp/victim", text, tarfile.REGTYPE, "")]),
                 ("absolute", [("/tmp/victim", text, tarfile.REGTYPE, "")]),
                 ("symlink", [("Brand", b"", tarfile.SYMTYPE, "/etc")]),
                 ("through a symlink", [("Brand", b"", tarfile.SYMTYPE, "/tmp"), ("Brand/victim", text, tarfile.REGTYPE, "")]),
                 ("hard link", [("Brand", b"", tarfile.LNKTYPE, "/tmp/victim")]),
                 ("device", [("Brand", b"", tarfile.FIFOTYPE, "")]),
                 ("bomb", [(f"Brand/{i}", bytes(60 << 20), tarfile.REGTYPE, "") for i in range(3)]))
        self.serve_from("good")
        for name, members in table:
            with self.subTest(name=name):
                with open(f"{SERVED}/routerdb.tgz", "wb") as file:
                    file.write(archive(*members))
                self.assertEqual(update_models()[0], 0)
                self.unchanged()
                self.assertEqual(LAB.read("/tmp/victim"), "untouched")

    def test_only_a_sound_database_is_packed(self):
        def packs(change):
            shutil.rmtree("/tmp/bad", ignore_errors=True)
            shutil.copytree("/tmp/edition", "/tmp/bad")
            change()
            shutil.rmtree("/tmp/packed", ignore_errors=True)
            done = LAB.run("box", f"{SCRIPTS}/make-routerdb /tmp/bad /tmp/packed", check=False).returncode == 0
            self.assertEqual(os.path.exists("/tmp/packed/routerdb.tgz"), done)
            return done

        model = "/tmp/bad/Cobbler/Gate/1"
        self.assertTrue(packs(lambda: None))
        self.assertFalse(packs(lambda: os.unlink("/tmp/bad/version")))
        self.assertFalse(packs(lambda: os.symlink("1", "/tmp/bad/Cobbler/Gate/2")))
        self.assertFalse(packs(lambda: LAB.write(f"{model}/router.ops", "[PF add port]\npath=/a\n")))
        self.assertFalse(packs(lambda: LAB.write(f"{model}/router.des", '[global]\nsyntax version="2"\n')))


def prepare(lab):
    lab.start("wan", "/usr/bin/python3", f"{HERE}/file_server.py", SERVED, "8000", stderr=subprocess.DEVNULL)
    wait_for(lambda: lab.run("box", f"curl -s http://{WAN}:8000/", check=False).returncode == 0, 10, "the server is up")


if __name__ == "__main__":
    run_tests(prepare)
