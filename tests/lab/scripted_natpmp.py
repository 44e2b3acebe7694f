"""A NAT-PMP gateway with faults on the LAN address. Usage: scripted_natpmp.py FAULT [CODE].

Keeps its table and its counters as JSON in STATE. SIGUSR1 is a reboot that it announces (with the
fault "pcp" by PCP alone), SIGUSR2 one that it does not.
"""
import json
import os
import signal
import socket
import struct
import sys
import time

ADDRESS, STATE = "192.168.77.1", "/tmp/natpmp_gateway.json"
FAULT, CODE = sys.argv[1], int((sys.argv + ["0"])[2])
TABLE, COUNT = {}, {}
START = time.monotonic()


def head(opcode, code=0, version=0):
    return struct.pack("!BBHI", version, 128 + opcode, code, int(time.monotonic() - START) + 5000 * (COUNT.get("boot", 0) == 0))


def keep(counter):
    COUNT[counter] = COUNT.get(counter, 0) + 1
    with open(STATE + ".new", "w", encoding="ascii") as file:
        json.dump({"table": TABLE, "count": COUNT}, file)
    os.rename(STATE + ".new", STATE)


def answer(opcode, port, external, lifetime):
    if opcode == 0:
        return head(0) + socket.inet_aton("198.41.0.4")
    if FAULT in ("version", "garbage"):
        return head(opcode) + struct.pack("!HHI", port, external, lifetime)
    if FAULT == "refuse" or (FAULT == "short_lease" and port == 5002):
        code = CODE if FAULT == "refuse" else 4
        return head(opcode, code) + (struct.pack("!HHI", port, 0, 0) if code != 2 else b"")
    name = f"{'udp' if opcode == 1 else 'tcp'} {port}"
    if lifetime == 0:
        if FAULT == "will_not_close":
            return head(opcode, 2) + struct.pack("!HHI", port, 0, 0)
        TABLE.pop(name, None)
        return head(opcode) + struct.pack("!HHI", port, 0, 0)
    TABLE[name] = external + (FAULT in ("other_port", "will_not_close"))
    return head(opcode) + struct.pack("!HHI", port, TABLE[name], CODE if FAULT == "short_lease" else lifetime)


def datagrams(request):
    opcode = request[1]
    port, external, lifetime = struct.unpack("!HHI", request[4:]) if opcode else (0, 0, 0)
    keep(f"opcode {opcode}")
    if FAULT == "silent" or (FAULT == "lossy" and COUNT[f"opcode {opcode}"] % 3):
        return []
    good = answer(opcode, port, external, lifetime)
    keep("answer")
    return {"version": [head(opcode, 1, 2)], "garbage": [b"\xff" * 900, b"\0" * 16, b"", good[:7], good[:11], good[:1] + b"\x85" + good[2:]],
            "late": [head(2) + struct.pack("!HHI", 9, 9, 9), good],
            }.get(FAULT, [good])


def reboot(number, _):
    global START
    TABLE.clear()
    START = time.monotonic()
    keep("boot")
    if number == signal.SIGUSR1 and FAULT == "pcp":
        SOCK.sendto(struct.pack("!BBBBII12x", 2, 0x80, 0, 0, 0, 0), ("224.0.0.1", 5350))
    elif number == signal.SIGUSR1:
        SOCK.sendto(head(0) + socket.inet_aton("198.41.0.4"), ("224.0.0.1", 5350))


SOCK = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
SOCK.bind((ADDRESS, 5351 if FAULT != "closed" else 5352))
SOCK.setsockopt(socket.IPPROTO_IP, socket.IP_MULTICAST_IF, socket.inet_aton(ADDRESS))
signal.signal(signal.SIGUSR1, reboot)
signal.signal(signal.SIGUSR2, reboot)
keep("start")
while True:
    data, peer = SOCK.recvfrom(100)
    for datagram in datagrams(data):
        SOCK.sendto(datagram, peer)
