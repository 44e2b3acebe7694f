"""A home network on one machine: box, lan2 and wan as namespaces, a router between them.

Runs inside tests/sandbox, so that no root is needed and all paths and processes are the test's own.
The router is Debian's miniupnpd on nftables; scripted_router.py takes its place where a test wants a
router with faults. Every wait polls to a deadline; every process started here is ended by its pid.
"""
import json
import os
import re
import shutil
import signal
import subprocess
import sys
import time
import unittest
from xml.sax.saxutils import escape

BUILD = os.environ["TAVO_BUILD_DIR"]
HERE = os.path.dirname(os.path.abspath(__file__))
GATEWAY, BOX, LAN2 = "192.168.77.1", "192.168.77.2", "192.168.77.3"
ROUTER_WAN, WAN = "203.0.113.2", "203.0.113.9"
PUBLIC = "198.41.0.4"  # what the daemon says its outside address is; it refuses reserved ones
STATUS = "/var/tmp/upnp_portmap.status"
REMAP = "/var/tmp/natpmp_portmap.remap"
DAEMONS = ("upnpd", "natpmpd")
TOOL = f"{BUILD}/cli/tavoportmap"
LAB = None  # also of each file of tests, once its cases begin

NFT = """
table inet home {
  chain miniupnpd { }
  chain prerouting_miniupnpd { }
  chain postrouting_miniupnpd { }
  chain prerouting {
    type nat hook prerouting priority dstnat
    jump prerouting_miniupnpd
  }
  chain postrouting {
    type nat hook postrouting priority srcnat
    jump postrouting_miniupnpd
    oifname "wan0" masquerade
  }
  chain forward {
    type filter hook forward priority filter; policy drop
    ct state established,related accept
    iifname "br0" accept
    jump miniupnpd
  }
}
"""

WEB_MODELS = {"form": ("Alderman", "Homestead 2", "1.0"), "json": ("Brightwater", "R300", "2.1"),
              "blind": ("Cobbler", "Gate", "7.3")}  # 7.3 has no description of its own
WEB_PASSWORD = r'p&ss=1\"\\{user}%0d\r\n'  # as a settings file holds it
AVAHI = "/usr/sbin/avahi-daemon --no-drop-root --no-chroot --no-rlimits --no-proc-title"
AVAHI_CONF = """
[server]
host-name={name}
use-ipv6=no
enable-dbus={dbus}
[publish]
publish-workstation=no
"""
AIRPORT_SERVICE = """<?xml version="1.0" standalone="no"?><!DOCTYPE service-group SYSTEM "avahi-service.dtd">
<service-group><name>{name}</name><service><type>_airport._tcp</type><port>5009</port></service></service-group>
"""
# What an init script of avahi does, for a place where nobody else looks after services.
AVAHI_INIT = f"""#!/bin/sh
case $1 in restart|stop)
    {AVAHI} --check && {AVAHI} --kill
    while {AVAHI} --check; do sleep 0.02; done ;;
esac
case $1 in restart|start) {AVAHI} --daemonize -f /etc/avahi/box.conf ;; esac
"""
BUS = "/run/dbus/system_bus_socket"
DBUS_CONF = f"""<busconfig>
  <type>system</type>
  <listen>unix:path={BUS}</listen>
  <auth>EXTERNAL</auth>
  <policy context="default"><allow user="*"/><allow own="*"/><allow send_destination="*"/>
    <allow receive_sender="*"/></policy>
</busconfig>
"""


class CommandFailed(RuntimeError):
    """In the words of the command."""


def sh(command, check=True, **kwargs):
    done = subprocess.run(command, shell=True, text=True, capture_output=True, **kwargs)
    if check and done.returncode:
        raise CommandFailed(f"{command}\n  ended with {done.returncode}: {(done.stderr or done.stdout).strip()}")
    return done


def wait_for(condition, seconds, what):
    end = time.monotonic() + seconds
    while True:
        value = condition()
        if value:
            return value
        if time.monotonic() > end:
            raise AssertionError(f"not within {seconds} s: {what}")
        time.sleep(0.05)


class Detached:
    """A process that went into the background by itself, with what Lab.end() asks of a process."""

    def __init__(self, pid_file):
        wait_for(lambda: os.path.exists(pid_file) and os.path.getsize(pid_file), 5, f"{pid_file} is there")
        with open(pid_file, encoding="ascii") as file:
            self.pid = int(file.read())
        os.unlink(pid_file)

    def poll(self):
        return None if os.path.exists(f"/proc/{self.pid}") else 0

    def kill(self):
        os.kill(self.pid, signal.SIGKILL)

    def wait(self):
        wait_for(lambda: self.poll() is not None, 5, f"process {self.pid} has ended")


class Lab:
    def __init__(self):
        self.processes = []
        self.router = None
        try:
            self.wire()
        except CommandFailed as failure:
            sys.exit(f"The home network cannot be made. This failed: {failure}\nIt takes the kernel's veth, bridge and "
                     "nf_tables, and in a container /proc and /sys as on a machine (with Docker: --privileged).")
        self.install()

    def wire(self):
        """The hosts, their links and the router's packet filter."""
        for name in ("box", "lan2", "router", "wan"):
            sh(f"ip netns add {name} && ip -n {name} link set lo up")
        sh("ip -n router link add br0 type bridge && ip -n router link set br0 up")
        for name, address in (("box", BOX), ("lan2", LAN2)):
            sh(f"ip link add {name}0 netns {name} type veth peer name {name}1 netns router && "
               f"ip -n router link set {name}1 master br0 up && "
               f"ip -n {name} addr add {address}/24 dev {name}0 && ip -n {name} link set {name}0 up && "
               f"ip -n {name} route add default via {GATEWAY}")
        sh(f"ip link add wan0 netns router type veth peer name out0 netns wan && "
           f"ip -n router addr add {GATEWAY}/24 dev br0 && ip -n router addr add {ROUTER_WAN}/24 dev wan0 && "
           f"ip -n router link set wan0 up && ip -n wan addr add {WAN}/24 dev out0 && ip -n wan link set out0 up")
        self.run("router", "sysctl -qw net.ipv4.ip_forward=1")
        self.run("router", "nft -f -", input=NFT)

    # ---- the box's files ------------------------------------------------------------------------

    def install(self, natpmp=False):
        for directory in ("/etc/portforward", "/etc.defaults/portforward/routerdb", "/usr/tavo/sbin",
                          "/usr/tavo/bin", "/etc/tavo"):
            os.makedirs(directory, exist_ok=True)
        for program in (*(f"sbin/{daemon}" for daemon in DAEMONS), "sbin/tavoairportd", "bin/tavoportforward",
                        "bin/tavopages", "bin/tavohook"):
            if os.path.lexists(f"/usr/tavo/{program}"):
                os.unlink(f"/usr/tavo/{program}")
            os.symlink(f"{BUILD}/programs/{os.path.basename(program)}", f"/usr/tavo/{program}")
        self.settings()
        self.router_conf(natpmp)
        self.write("/etc/portforward/router_upnp.db", '[Lab/One/1]\nsupport="yes"\nmax="100"\n')

    def settings(self, check_interval=120, lease=3600):
        self.write("/etc/tavo/platform.conf", "".join(
            f'[{daemon}]\ncheck_interval="{check_interval}"\nlease="{lease}"\n' for daemon in DAEMONS))

    def router_conf(self, natpmp):
        self.write("/etc/portforward/router.conf",
                   f'[{GATEWAY}]\nbrand="Lab"\nmodel="One"\nversion="1"\nsupport_router_upnp="yes"\n'
                   f'support_router_natpmp="{"yes" if natpmp else "no"}"\n')

    @staticmethod
    def clear_state(*more):
        """What a save and the daemons leave behind."""
        for path in ("/etc/portforward/rule.conf", "/tmp/pfProgress", "/var/lib/tavo/upnp_igd.conf",
                     "/var/lib/tavo/upnp_made.conf", "/var/lib/tavo/natpmp_made.conf", *more):
            if os.path.exists(path):
                os.unlink(path)

    @staticmethod
    def write(path, text):
        with open(path, "w", encoding="utf-8") as file:
            file.write(text)

    # ---- processes --------------------------------------------------------------------------------

    def run(self, host, command, check=True, **kwargs):
        return sh(f"ip netns exec {host} {command}", check=check, **kwargs)

    def start(self, host, *command, **kwargs):
        process = subprocess.Popen(["ip", "netns", "exec", host, *command], stdin=subprocess.DEVNULL, **kwargs)
        self.processes.append(process)
        return process

    @staticmethod
    def end(process):
        if process.poll() is None:
            process.kill()
        process.wait()

    def daemon_pid(self, daemon="upnpd"):
        try:
            with open(f"/var/run/{daemon}.pid", encoding="ascii") as file:
                pid = int(file.read())
            os.kill(pid, 0)
            return pid
        except (OSError, ValueError):
            return 0

    @staticmethod
    def processes_of(command):
        """The pids of a whole command line."""
        def line(pid):
            try:
                with open(f"/proc/{pid}/cmdline", "rb") as file:
                    return file.read().rstrip(b"\0").replace(b"\0", b" ").decode()
            except OSError:
                return ""
        return [int(pid) for pid in os.listdir("/proc") if pid.isdigit() and line(pid) == command]

    def watcher(self, daemon="upnpd"):
        """The pid of the parent that would start a daemon again; 0: there is none."""
        try:
            pid = int(self.read(f"/var/run/{daemon}_watch.lock"))
            return pid if self.read(f"/proc/{pid}/comm") == "tavowatch\n" else 0
        except (OSError, ValueError):
            return 0

    def stop_daemon(self, how=signal.SIGTERM, *daemons):
        for daemon in daemons or DAEMONS:
            watcher = self.watcher(daemon)
            if watcher and how == signal.SIGKILL:
                os.kill(watcher, how)
                wait_for(lambda: not self.watcher(daemon), 5, "nobody starts the daemon again")
            pid = self.daemon_pid(daemon)
            if pid:
                os.kill(pid, how)
                wait_for(lambda: not os.path.exists(f"/proc/{pid}"), 70, "the daemon has ended")

    def close(self):
        self.stop_daemon(signal.SIGKILL)
        for process in self.processes:
            self.end(process)

    # ---- the real router ----------------------------------------------------------------------------

    def start_router(self, version1=False, port=5000, upnp=True, secure=True, wait=True):
        self.write("/tmp/miniupnpd.conf", "\n".join((
            "ext_ifname=wan0", f"ext_ip={PUBLIC}", "listening_ip=br0", f"http_port={port}", "enable_natpmp=yes",
            f"enable_upnp={'yes' if upnp else 'no'}", f"secure_mode={'yes' if secure else 'no'}", "upnp_table_name=home", "upnp_nat_table_name=home",
            "upnp_forward_chain=miniupnpd", "upnp_nat_chain=prerouting_miniupnpd",
            "upnp_nat_postrouting_chain=postrouting_miniupnpd", "uuid=00000000-0000-0000-0000-000000000001",
            "force_igd_desc_v1=" + ("yes" if version1 else "no"), "allow 1-65535 192.168.77.0/24 1-65535",
            "deny 0-65535 0.0.0.0/0 0-65535", "")))
        # In the background as on any router: kept in front it runs in debug mode, where it logs every entry
        # that it looks at, and on a machine without a system log it does so on a serial console.
        self.run("router", "/usr/sbin/miniupnpd -f /tmp/miniupnpd.conf -P /tmp/miniupnpd.pid >/dev/null 2>&1")
        self.router = Detached("/tmp/miniupnpd.pid")
        self.processes.append(self.router)
        if not wait:
            return
        wait_for((lambda: self.run("box", f"curl -sf -o /dev/null http://{GATEWAY}:{port}/rootDesc.xml",
                                   check=False).returncode == 0) if upnp else
                 lambda: self.run("router", "ss -Hlun sport = :5351").stdout, 10, "the router is up")

    def stop_router(self):
        """Without a word to anybody, as when the power goes."""
        if self.router is not None:
            self.end(self.router)
        self.router = None
        for chain in ("miniupnpd", "prerouting_miniupnpd", "postrouting_miniupnpd"):
            self.run("router", f"nft flush chain inet home {chain}")

    def start_scripted(self, fault, port=5000, host="router", address=GATEWAY):
        self.router = self.start(host, "/usr/bin/python3", f"{HERE}/scripted_router.py", fault, str(port), address,
                                 stderr=subprocess.DEVNULL)
        wait_for(lambda: self.scripted(port, address), 10, "the scripted router is up")

    def scripted(self, port=5000, address=GATEWAY):
        """Its table and its counters."""
        out = self.run("box", f"curl -s -m 5 http://{address}:{port}/table", check=False).stdout
        return json.loads(out) if out else None

    def reboot_router(self, **kwargs):
        self.stop_router()
        self.start_router(**kwargs)

    def mappings(self):
        """What the router really does, from its packet filter: {(protocol, port): (host, port)}."""
        rules = self.run("router", "nft list chain inet home prerouting_miniupnpd").stdout
        number = {"0x6": "tcp", "0x11": "udp"}
        return {(number.get(m[1], m[1]), int(m[2])): (m[3], int(m[4])) for m in re.finditer(
            r"(0x6|0x11|tcp|udp) (?:th )?dport (\d+) .*?dnat ip to ([\d.]+):(\d+)", rules)}

    def map_foreign(self, port, protocol="TCP"):
        self.run("lan2", f"upnpc -a {LAN2} {port} {port} {protocol}")

    # ---- a router with web pages only --------------------------------------------------------------------

    def start_web(self, flavour, fault="none", tls=False):
        """The scripted web router, and its settings and description on the box."""
        brand, name, version = WEB_MODELS[flavour]
        shutil.rmtree("/etc.defaults/portforward/routerdb", ignore_errors=True)
        shutil.copytree(f"{HERE}/../../packaging/routerdb", "/etc.defaults/portforward/routerdb")
        certificate = []
        if tls:
            certificate = ["/tmp/router.pem"]
            sh("openssl req -x509 -newkey rsa:1024 -nodes -days 2 -subj /CN=router -keyout /tmp/router.pem "
               "-out /tmp/router.crt && cat /tmp/router.crt >>/tmp/router.pem")
        self.write("/etc/portforward/router.conf",
                   f'[{GATEWAY}]\nbrand="{brand}"\nmodel="{name}"\nversion="{version}"\nsupport_router_upnp="no"\n'
                   f'support_router_natpmp="no"\nuser="admin"\npass="{WEB_PASSWORD}"\n'
                   f'conn_type="{"https" if tls else "http"}"\nconn_port="8080"\n')
        self.router = self.start("router", "/usr/bin/python3", f"{HERE}/web_router.py", flavour, fault, "8080",
                                 *certificate, stderr=subprocess.DEVNULL)
        return wait_for(self.web_state, 10, "the web router is up")

    def web_state(self):
        """Its table and how often each page was asked for."""
        for scheme in ("http", "https"):
            out = self.run("box", f"curl -sk --tlsv1.0 --ciphers DEFAULT:@SECLEVEL=0 -m 5 {scheme}://{GATEWAY}:8080/state", check=False).stdout
            if out:
                return json.loads(out)
        return None

    # ---- avahi ------------------------------------------------------------------------------------------

    def prepare_avahi(self):
        """The sandbox has no user but root, to whom avahi can give its directory."""
        for path, ids in (("/etc/passwd", "0:0"), ("/etc/group", "0")):
            self.write(path, re.sub(r"(?m)^avahi:x:[\d:]+?:(?=\D|$)", f"avahi:x:{ids}:", self.read(path)))
        os.makedirs("/run/avahi-daemon", exist_ok=True)

    def start_avahi(self):
        """D-Bus, avahi with its init script, and the publisher of base stations, all on the box."""
        self.prepare_avahi()
        self.write("/etc/init.d/avahi-daemon", AVAHI_INIT)
        os.chmod("/etc/init.d/avahi-daemon", 0o755)
        self.write("/etc/avahi/box.conf", AVAHI_CONF.format(name="box", dbus="yes"))
        bus = self.start_bus()
        self.restart_avahi()
        return bus, self.start("box", "/usr/tavo/sbin/tavoairportd")

    def start_bus(self):
        self.write("/tmp/dbus.conf", DBUS_CONF)
        os.makedirs("/run/dbus", exist_ok=True)
        if os.path.exists(BUS):
            os.unlink(BUS)
        bus = self.start("box", "/usr/bin/dbus-daemon", "--config-file=/tmp/dbus.conf", "--nofork", "--nopidfile",
                         stderr=subprocess.DEVNULL)
        wait_for(lambda: os.path.exists(BUS), 10, "the bus is up")
        return bus

    def restart_avahi(self, verb="restart"):
        self.run("box", f"/etc/init.d/avahi-daemon {verb}")

    def publish_airport(self, host, *names):
        """An AirPort base station: announces one service for each name from the host's own address, until
        the process returned is ended (terminate: with a goodbye; kill: without)."""
        self.prepare_avahi()
        directory = f"/tmp/airport.{host}"
        shutil.rmtree(directory, ignore_errors=True)
        os.makedirs(directory)
        for number, name in enumerate(names):
            self.write(f"{directory}/{number}.service", AIRPORT_SERVICE.format(name=escape(name)))
        self.write(f"/etc/avahi/{host}.conf", AVAHI_CONF.format(name=f"station-{host}", dbus="no"))
        # Two avahi daemons share the paths of this machine: this one gets its own places over them.
        return self.start(host, "/bin/sh", "-c", "mount -t tmpfs tmpfs /run/avahi-daemon && "
                          f"mount --bind {directory} /etc/avahi/services && "
                          f"exec {AVAHI} -f /etc/avahi/{host}.conf", stderr=subprocess.DEVNULL)

    # ---- connections ----------------------------------------------------------------------------------

    def serve(self, *ports):
        """An echo on the box for TCP and UDP."""
        self.start("box", "/usr/bin/python3", f"{HERE}/echo.py", "serve", *map(str, ports))
        wait_for(lambda: all(self.run("box", f"/usr/bin/python3 {HERE}/echo.py tcp 127.0.0.1 {p}",
                                      check=False).returncode == 0 for p in ports), 10, "the echo is up")

    def reaches(self, protocol, port):
        """Whether a stranger outside gets an answer through the router."""
        return self.run("wan", f"/usr/bin/python3 {HERE}/echo.py {protocol} {ROUTER_WAN} {port}",
                        check=False).returncode == 0

    # ---- saving ---------------------------------------------------------------------------------------

    def start_save(self, *rules):
        """Rules are "id,enabled,protocol,router port,box port" with ";" between several ports."""
        return self.start("box", f"{BUILD}/tests/lab/saver", GATEWAY, *rules,
                          stdout=subprocess.PIPE, stderr=subprocess.DEVNULL, text=True)

    def save(self, *rules, seconds=60):
        out, _ = self.start_save(*rules).communicate(timeout=seconds)
        return json.loads(out)

    @staticmethod
    def read(path):
        with open(path, encoding="utf-8") as file:
            return file.read()

    @staticmethod
    def status():
        with open(STATUS, encoding="utf-8") as file:
            return dict(line.rstrip("\n").split("=", 1) for line in file)


class Case(unittest.TestCase):
    """Leaves nothing of a router and of a daemon."""

    def tearDown(self):
        LAB.stop_daemon(signal.SIGKILL)
        LAB.stop_router()
        LAB.clear_state()


def only_box(mappings):
    return {key: port for key, (host, port) in mappings.items() if host == BOX}


def in_lab(main):
    lab = Lab()
    try:
        return main(lab)
    finally:
        lab.close()


def run_tests(tests):
    """Runs the cases of the calling file, as tests(lab) prepares them, and prints a summary."""
    def main(lab):
        for module in list(sys.modules.values()):
            if "LAB" in vars(module):
                module.LAB = lab
        tests(lab)
        result = unittest.main(exit=False, verbosity=2, warnings="ignore").result
        failed = min(result.testsRun, len(result.failures) + len(result.errors))
        print(f"{result.testsRun - failed} passed, {failed} failed")
        return 1 if failed or not result.testsRun else 0

    sys.exit(in_lab(main))


if __name__ == "__main__":  # says what this machine lacks, before anything is built
    Lab()
