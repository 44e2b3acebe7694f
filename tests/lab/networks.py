"""The networks that a detection meets: names and hosts outside, a second router in front of the first."""
import subprocess

from homelab import HERE, ROUTER_WAN, WAN, sh

WAN_PORT = 8053  # the host outside that the box tries to reach
NAME = "home.example"


class Outside:
    """What the box expects outside: a host that answers, and a name server."""

    def __init__(self, lab, avahi=True):
        self.lab = lab
        self.names = None
        lab.start("wan", "/usr/bin/python3", f"{HERE}/echo.py", "serve", str(WAN_PORT))
        lab.write("/etc/resolv.conf", f"nameserver {WAN}\n")
        self.bus, self.publisher = lab.start_avahi() if avahi else (None, None)
        self.settings()
        self.start_names()

    def settings(self):
        self.lab.write("/etc/tavo/platform.conf",
                       f'[network]\nwan_hosts="{WAN}:{WAN_PORT}"\ndns_name="{NAME}"\n')

    def start_names(self):
        self.names = self.lab.start("wan", "/usr/bin/python3", f"{HERE}/names.py", WAN, stdout=subprocess.PIPE)
        self.names.stdout.readline()

    def stop_names(self):
        self.lab.end(self.names)


def wire(lab, host, device, peer, peer_device, address, peer_address):
    sh(f"ip link add {device} netns {host} type veth peer name {peer_device} netns {peer}")
    for name, link, text in ((host, device, address), (peer, peer_device, peer_address)):
        sh(f"ip -n {name} addr add {text}/24 dev {link} && ip -n {name} link set {link} up")


def insert_outer(lab, prefix):
    """A second router, with an address translation of its own, between the first and the outside."""
    sh("ip netns add outer && ip -n outer link set lo up && ip -n router link del wan0")
    wire(lab, "router", "wan0", "outer", "in0", f"{prefix}.2", f"{prefix}.1")
    wire(lab, "outer", "out1", "wan", "out0", ROUTER_WAN, WAN)
    sh(f"ip -n router route add default via {prefix}.1")
    lab.run("outer", "sysctl -qw net.ipv4.ip_forward=1")
    lab.run("outer", "nft -f -", input="table ip outer {\n chain postrouting {\n"
            ' type nat hook postrouting priority srcnat\n oifname "out1" masquerade\n }\n}\n')


def remove_outer(lab):
    sh("ip netns del outer")
    sh("ip -n router link del wan0", check=False)
    sh("ip -n wan link del out0", check=False)
    wire(lab, "router", "wan0", "wan", "out0", ROUTER_WAN, WAN)
