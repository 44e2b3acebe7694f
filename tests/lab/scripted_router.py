"""A router with faults: SSDP and SOAP on the LAN address, behaving as the named fault says.

Usage: scripted_router.py FAULT [PORT [ADDRESS]]. GET /table gives its table and its counters as JSON; GET
/hang?SECONDS has it answer no action for so long, /outside?ADDRESS have another outside address, and
/take?PORT[,HOST,TEXT] lose a TCP mapping, to another host where one is named.
"""
import json
import re
import socket
import struct
import sys
import threading
import time
from http.server import BaseHTTPRequestHandler, ThreadingHTTPServer
from urllib.parse import unquote

FOREIGN = "192.168.77.3"
FAULT = sys.argv[1]
PORT = int(sys.argv[2]) if len(sys.argv) > 2 else 5000
ADDRESS = sys.argv[3] if len(sys.argv) > 3 else "192.168.77.1"
SERVICE = f"urn:schemas-upnp-org:service:WANIPConnection:{2 if FAULT == 'dies_of_ranges' else 1}"
TABLE, COUNT, ASKED_402 = {}, {}, set()
if FAULT == "conflict_foreign":
    TABLE[("TCP", 5001)] = (FOREIGN, 5001, 0, "theirs")

BRAND = {"hostile_brand": "x&quot;; [192.168.1.1]\nuser=&quot;me&quot;&#10;[192.168.77.1]" + "'/../" * 2000}.get(FAULT, "Lab")
DESCRIPTION = f"""<?xml version="1.0"?><root xmlns="urn:schemas-upnp-org:device-1-0"><device>
<deviceType>urn:schemas-upnp-org:device:InternetGatewayDevice:1</deviceType><manufacturer>{BRAND}</manufacturer>
<modelName>Scripted</modelName><modelNumber>7</modelNumber><serviceList><service>
<serviceType>{SERVICE}</serviceType><controlURL>/ctl</controlURL></service></serviceList></device></root>"""
SERVICES = "<service><serviceType>urn:x:service:Y:1</serviceType><controlURL>/n</controlURL></service>"
ENTITIES = "".join(f'<!ENTITY e{i + 1} "{f"&e{i};" * 10}">' for i in range(12))
BODIES = {"garbage_xml": "\0<<garbage", "deep_xml": "<device>" * 30000,
          "many_services": DESCRIPTION.replace("<service>", SERVICES * 2000 + "<service>", 1),
          "too_many_services": DESCRIPTION.replace("<service>", SERVICES * 10000 + "<service>", 1),
          "entities": f"<!DOCTYPE root [<!ENTITY e0 'x'>{ENTITIES}]><root><device>&e12;</device></root>"}
# What comes first, what comes then without end, and the seconds between.
STREAMS = {"endless_body": (b"HTTP/1.1 200 OK\r\n\r\n", b"<x>" * 10000, 0),
           "endless_header": (b"HTTP/1.1 200 OK\r\n", b"X-A: b\r\n" * 100, 0),
           "endless_line": (b"HTTP/1.1 200 OK\r\nX-A: ", b"b" * 1000, 0),
           "endless_chunks": (b"HTTP/1.1 200 OK\r\nTransfer-Encoding: chunked\r\n\r\n", b"3e8\r\n" + b"a" * 1000 + b"\r\n", 0),
           "endless_100": (b"", b"HTTP/1.1 100 Continue\r\n\r\n" * 100, 0),
           "drip": (b"HTTP/1.1 200 OK\r\n\r\n", b"<", 1),
           "redirect": (f"HTTP/1.1 302 Found\r\nLocation: http://127.0.0.1:{PORT}/d.xml\r\nContent-Length: 0\r\n\r\n"
                        .encode(), b"", 1)}
QUICK = [name for name in (*BODIES, *STREAMS) if name not in ("drip", "many_services")]
HANG_UNTIL = 0
OUTSIDE = "198.41.0.4"
LOCATIONS = {"location_other_host": f"http://{FOREIGN}:5000/d.xml", "location_loopback": "http://127.0.0.1:5000/d.xml"}


def fault(code):
    return 500, (f"<s:Envelope xmlns:s='x'><s:Body><s:Fault><detail><UPnPError><errorCode>{code}</errorCode>"
                 "</UPnPError></detail></s:Fault></s:Body></s:Envelope>")


def answer(action, **values):
    inner = "".join(f"<{name}>{value}</{name}>" for name, value in values.items())
    return 200, f"<s:Envelope xmlns:s='x'><s:Body><u:{action}Response xmlns:u='y'>{inner}</u:{action}Response></s:Body></s:Envelope>"


def entry(key):
    client, port, lease, text = TABLE[key]
    return {"NewRemoteHost": "", "NewExternalPort": key[1], "NewProtocol": key[0], "NewInternalPort": port,
            "NewInternalClient": client, "NewEnabled": 1, "NewPortMappingDescription": text, "NewLeaseDuration": lease}


def add(key, client, port, lease, text):
    if FAULT == "action_failed_501":
        return fault(501)
    if FAULT == "conflict_secure" and key[1] == 5001:
        return fault(718)
    if FAULT == "only_permanent" and lease:
        return fault(725)
    if FAULT == "invalid_args_402" and lease:
        return fault(402)
    if key in TABLE and TABLE[key][0] != client:
        return fault(718)
    if FAULT == "refuses_again" and COUNT.get("DeletePortMapping"):
        return fault(501)
    if FAULT == "says_full_at_32" and len(TABLE) >= 32:
        return fault(728)
    if not (FAULT == "full_at_32" and len(TABLE) >= 32) and FAULT != "keeps_nothing":
        TABLE[key] = (client, port, min(lease, 60) if FAULT == "lease_cut" else lease, text)
    return answer("AddPortMapping")


def act(action, args):
    key = (args.get("NewProtocol", ""), int(args.get("NewExternalPort") or 0))
    if action == "GetGenericPortMappingEntry":
        index = int(args["NewPortMappingIndex"])
        if FAULT == "endless_table":
            return answer(action, **{**entry(("TCP", 1)), "NewExternalPort": 7})
        return answer(action, **entry(sorted(TABLE)[index])) if index < len(TABLE) else fault(713)
    if action == "GetSpecificPortMappingEntry":
        if FAULT == "conflict_secure" and key[1] == 5001:
            return fault(606)
        return answer(action, **entry(key)) if key in TABLE else fault(714)
    if action == "GetExternalIPAddress":
        return answer(action, NewExternalIPAddress=OUTSIDE)
    if action == "DeletePortMapping" and FAULT == "gives_nothing_back":
        return fault(606)
    if action == "DeletePortMapping" and FAULT == "deletes_nothing":
        return answer(action)
    if action == "DeletePortMapping":
        return answer(action) if TABLE.pop(key, None) else fault(714)
    return add(key, args["NewInternalClient"], int(args["NewInternalPort"]), int(args["NewLeaseDuration"]),
               args["NewPortMappingDescription"])


class Handler(BaseHTTPRequestHandler):
    protocol_version = "HTTP/1.1"
    wbufsize = 65536  # an answer in one piece: in two, the second waits for the acknowledgement of the first

    def log_message(self, *args):
        pass

    def say(self, code, text):
        body = text.encode()
        self.send_response(code)
        self.send_header("Content-Length", str(len(body) * (2 if FAULT == "half_reply" and code != 299 else 1)))
        self.end_headers()
        self.wfile.write(body)
        if FAULT == "half_reply" and code != 299:
            self.close_connection = True

    def do_GET(self):
        COUNT[self.path] = COUNT.get(self.path, 0) + 1
        kind = self.path[1:] if FAULT == "bad_descriptions" else FAULT
        if self.path == "/table":
            self.say(299, json.dumps({"table": [[*key, *value] for key, value in TABLE.items()], "count": COUNT}))
        elif self.path.startswith("/hang?"):
            global HANG_UNTIL
            HANG_UNTIL = time.monotonic() + float(self.path[6:])
            self.say(299, "")
        elif self.path.startswith("/outside?"):
            global OUTSIDE
            OUTSIDE = self.path[9:]
            self.say(299, "")
        elif self.path.startswith("/take?"):
            port, *other = unquote(self.path[6:]).split(",")
            TABLE.pop(("TCP", int(port)), None)
            if other:
                TABLE[("TCP", int(port))] = (other[0], int(port), 0, other[1])
            self.say(299, "")
        elif kind in STREAMS:
            self.stream(*STREAMS[kind])
        elif FAULT == "silent":
            time.sleep(60)
        else:
            self.say(200, BODIES.get(kind, DESCRIPTION))

    def stream(self, first, then, pause):
        try:
            self.wfile.write(first)
            while True:
                self.wfile.write(then)
                time.sleep(pause)
        except OSError:
            self.close_connection = True

    def do_POST(self):
        action = self.headers["SOAPAction"].strip('"').split("#")[1]
        COUNT[action] = COUNT.get(action, 0) + 1
        body = self.rfile.read(int(self.headers["Content-Length"])).decode()
        if len(TABLE) >= 10 and (
                FAULT == "silent_at_10" or (FAULT == "silent_adds_at_10" and action == "AddPortMapping")):
            time.sleep(60)
        if FAULT == "late_reply" and action == "AddPortMapping":
            time.sleep(8)
        time.sleep(max(0, HANG_UNTIL - time.monotonic()))
        time.sleep(1 if FAULT == "slow" else 0)
        if FAULT == "drips_actions" and action == "AddPortMapping":
            self.stream(b"HTTP/1.1 200 OK\r\n\r\n", b"<", 1)
            return
        if FAULT == "dies_of_ranges" and action == "GetListOfPortMappings":
            self.wfile.write(b"HTTP/1.1 200 OK\r\nContent-Length: 99\r\n\r\n<")
            self.close_connection = True
            return
        if FAULT == "dies_listing" and action == "GetGenericPortMappingEntry" and "Index>1<" in body:
            self.close_connection = True
            return
        self.say(*act(action, dict(re.findall(r"<(New\w+)>([^<]*)<", body))))


def listen_ssdp():
    sock = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
    sock.setsockopt(socket.SOL_SOCKET, socket.SO_REUSEADDR, 1)
    sock.bind(("", 1900))
    sock.setsockopt(socket.IPPROTO_IP, socket.IP_ADD_MEMBERSHIP,
                    struct.pack("4s4s", socket.inet_aton("239.255.255.250"), socket.inet_aton(ADDRESS)))
    locations = [LOCATIONS.get(FAULT, f"http://{ADDRESS}:{PORT}/d.xml")]
    if FAULT == "ssdp_flood":
        locations = [f"http://{ADDRESS}@{FOREIGN}:{i}/d.xml" for i in range(5000)] + locations
    if FAULT == "bad_descriptions":  # the good one comes after all that end quickly
        locations = [f"http://{ADDRESS}:{PORT}/{name}" for name in QUICK] + locations
    while True:
        _, peer = sock.recvfrom(2000)
        COUNT["ssdp"] = COUNT.get("ssdp", 0) + 1
        for location in locations:
            sock.sendto(f"HTTP/1.1 200 OK\r\nST: x\r\nLOCATION: {location}\r\n\r\n".encode(), peer)


if __name__ == "__main__":
    TABLE.update({("TCP", 1): (FOREIGN, 1, 0, "theirs")} if FAULT in ("endless_table", "dies_listing") else {})
    TABLE.update({("TCP", 2): ("192.168.77.2", 2, 0, "tavo:old")} if FAULT in ("gives_nothing_back", "dies_listing") else {})
    threading.Thread(target=listen_ssdp, daemon=True).start()
    ThreadingHTTPServer((ADDRESS, PORT), Handler).serve_forever()
