"""A router with faults: SSDP and SOAP on the LAN address, behaving as the named fault says.

Usage: scripted_router.py FAULT [PORT [ADDRESS]]. GET /table gives its table and its counters as JSON.
"""
import json
import re
import socket
import struct
import sys
import threading
import time
from http.server import BaseHTTPRequestHandler, ThreadingHTTPServer

FOREIGN = "192.168.77.3"
FAULT = sys.argv[1]
PORT = int(sys.argv[2]) if len(sys.argv) > 2 else 5000
ADDRESS = sys.argv[3] if len(sys.argv) > 3 else "192.168.77.1"
SERVICE = "urn:schemas-upnp-org:service:WANIPConnection:1"
TABLE, COUNT, ASKED_402 = {}, {}, set()
if FAULT == "conflict_foreign":
    TABLE[("TCP", 5001)] = (FOREIGN, 5001, 0, "theirs")

BRAND = {"hostile_brand": "x&quot;; [192.168.1.1]\nuser=&quot;me&quot;&#10;[192.168.77.1]" + "'/../" * 2000}.get(FAULT, "Lab")
DESCRIPTION = f"""<?xml version="1.0"?><root xmlns="urn:schemas-upnp-org:device-1-0"><device>
<deviceType>urn:schemas-upnp-org:device:InternetGatewayDevice:1</deviceType><manufacturer>{BRAND}</manufacturer>
<modelName>Scripted</modelName><modelNumber>7</modelNumber><serviceList><service>
<serviceType>{SERVICE}</serviceType><controlURL>/ctl</controlURL></service></serviceList></device></root>"""
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
    if action == "DeletePortMapping":
        return answer(action) if TABLE.pop(key, None) else fault(714)
    return add(key, args["NewInternalClient"], int(args["NewInternalPort"]), int(args["NewLeaseDuration"]),
               args["NewPortMappingDescription"])


class Handler(BaseHTTPRequestHandler):
    protocol_version = "HTTP/1.1"

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
        if self.path == "/table":
            self.say(299, json.dumps({"table": [[*key, *value] for key, value in TABLE.items()], "count": COUNT}))
        elif FAULT == "endless_body":
            self.send_response(200)
            self.end_headers()
            while True:
                self.wfile.write(b"<x>" * 10000)
        elif FAULT == "silent":
            time.sleep(60)
        else:
            self.say(200, "\0<<garbage" if FAULT == "garbage_xml" else DESCRIPTION)

    def do_POST(self):
        action = self.headers["SOAPAction"].strip('"').split("#")[1]
        COUNT[action] = COUNT.get(action, 0) + 1
        body = self.rfile.read(int(self.headers["Content-Length"])).decode()
        if FAULT == "late_reply" and action == "AddPortMapping":
            time.sleep(8)
        self.say(*act(action, dict(re.findall(r"<(New\w+)>([^<]*)<", body))))


def listen_ssdp():
    sock = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
    sock.setsockopt(socket.SOL_SOCKET, socket.SO_REUSEADDR, 1)
    sock.bind(("", 1900))
    sock.setsockopt(socket.IPPROTO_IP, socket.IP_ADD_MEMBERSHIP,
                    struct.pack("4s4s", socket.inet_aton("239.255.255.250"), socket.inet_aton(ADDRESS)))
    location = LOCATIONS.get(FAULT, f"http://{ADDRESS}:{PORT}/d.xml")
    while True:
        _, peer = sock.recvfrom(2000)
        COUNT["ssdp"] = COUNT.get("ssdp", 0) + 1
        sock.sendto(f"HTTP/1.1 200 OK\r\nST: x\r\nLOCATION: {location}\r\n\r\n".encode(), peer)


if __name__ == "__main__":
    TABLE.update({("TCP", 1): (FOREIGN, 1, 0, "theirs")} if FAULT == "endless_table" else {})
    threading.Thread(target=listen_ssdp, daemon=True).start()
    ThreadingHTTPServer((ADDRESS, PORT), Handler).serve_forever()
