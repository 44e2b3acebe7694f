"""The main job, shown: a box learns what its router is, the user's rules and a relay service's request go
into a real router, and a stranger outside tries each port. Everything is said by the tool itself."""
import os
import shlex
import subprocess
import sys
import tempfile
import time

import homelab
import networks
from homelab import BOX, BUILD, LAN2, TOOL, WAN, wait_for

CHECKD = f"{BUILD}/programs/tavoportcheckd"
TOKEN, CHECK_PORT = "0123456789abcdef-story", 8099
FOREIGN = {("tcp", 5001): (LAN2, 5001), ("tcp", 9999): (LAN2, 9999)}
PROBES = (("tcp", 8443), ("udp", 6001), ("tcp", 5000), ("tcp", 5001), ("udp", 6000))
SILENCE = 5  # seconds, after which the demonstration says that it goes on
SOME_STAY_OUT = 4  # the tool's exit status for it
ROW = "  {:<10} {:<22} {:<24} {:<8} {}"


class Story:
    def __init__(self, lab):
        self.lab = lab
        self.wrong = 0

    def tool(self, command):
        print(f"\n$ tavoportmap {command}", flush=True)
        start = time.monotonic()
        with tempfile.TemporaryFile("w+") as out, tempfile.TemporaryFile("w+") as err:
            running = self.lab.start("box", TOOL, *shlex.split(command), stdout=out, stderr=err)
            while True:
                try:
                    running.wait(timeout=SILENCE)
                    break
                except subprocess.TimeoutExpired:
                    print(f"  ... {time.monotonic() - start:.0f} s", flush=True)
            for said in (out, err) if running.returncode else (out,):
                said.seek(0)
                print("".join(f"  {line}" for line in said), end="", flush=True)
        return running.returncode

    def expect(self, command, status=0):
        if self.tool(command) != status:
            self.wrong += 1
            print(f"  WRONG: this should have ended with {status}")

    def show(self, **wanted):
        """wanted: "tcp8443": box port. A port that nobody asked for must be closed, another host's untouched."""
        asked = {(name[:3], int(name[3:])): (BOX, port) for name, port in wanted.items()}
        everything = {**FOREIGN, **asked}
        try:
            wait_for(lambda: self.lab.mappings() == everything, 10, "the router follows")
        except AssertionError:
            pass  # the table says what is different
        there = self.lab.mappings()
        print("\n" + ROW.format("port", "asked for", "the router's mapping", "outside", ""))
        for probe in PROBES:
            mapping = there.get(probe)
            outcome = "open" if self.lab.reaches(*probe) else "closed"
            right = mapping == everything.get(probe) and (outcome == "open") == (probe in asked)
            self.wrong += not right
            verdict = "WRONG" if not right else "another host's, untouched" if probe in FOREIGN else "as asked"
            print(ROW.format(f"{probe[1]}/{probe[0]}", f"box port {asked[probe][1]}" if probe in asked else "-",
                             "%s:%d" % mapping if mapping else "-", outcome, verdict))
        for surplus in set(there) - set(everything):
            self.wrong += 1
            print(ROW.format(f"{surplus[1]}/{surplus[0]}", "-", "%s:%d" % there[surplus], "", "WRONG"))


def prepare(lab):
    """A box that knows nothing of its router, a port checker outside, and another host's mappings."""
    os.unlink("/etc/portforward/router.conf")
    outside = networks.Outside(lab)
    outside.settings()
    with open("/etc/tavo/platform.conf", "a", encoding="ascii") as file:
        file.write(f'[portcheck]\nurl="http://{WAN}:{CHECK_PORT}"\ntoken="{TOKEN}"\n')
    lab.write("/etc/tavo/portcheck.conf", f'[portcheck]\ntoken="{TOKEN}"\nlisten="0.0.0.0:{CHECK_PORT}"\n')
    os.chmod("/etc/tavo/portcheck.conf", 0o600)
    lab.start("wan", CHECKD)
    lab.serve(5000, 5001, 5002, 5003, 6000)
    lab.start_router()
    for _, port in FOREIGN:
        lab.map_foreign(port)


def main(lab):
    prepare(lab)
    story = Story(lab)
    print("What router is this, and does it do what it says? (a test of about a minute)")
    story.expect("service detect")
    story.expect("status")

    print("\nThe user's rules")
    story.expect("rules add web --router-port 8443 --box-port 5002")
    story.expect("rules add game --protocol udp --router-port 6001 --box-port 5003")
    story.expect("save")
    story.show(tcp8443=5002, udp6001=5003)

    print("\nA relay service asks for ports, one of which another host holds")
    request = "5000/tcp 5001/tcp 6000/udp"
    story.tool(f"service plan hoplink {request}")
    story.expect(f"service set hoplink {request} --test", SOME_STAY_OUT)
    story.show(tcp8443=5002, udp6001=5003, tcp5000=5000, udp6000=6000)

    print("\nThe service leaves; the user changes a rule")
    story.expect("service clear hoplink")
    story.expect("rules remove 2")
    story.expect("save")
    story.show(tcp8443=5002)

    print("\nNo rules")
    story.expect("rules remove 1")
    story.expect("save")
    story.show()
    print("\n" + ("All as asked." if not story.wrong else f"{story.wrong} differ."))
    return 1 if story.wrong else 0


if __name__ == "__main__":
    sys.exit(homelab.in_lab(main))
