"""A router that has web pages and nothing else: three flavours of pages, and faults that a test chooses.

Usage: web_router.py FLAVOUR FAULT PORT [CERTIFICATE]. What its table holds it really forwards, through the
packet filter of its namespace. Account: admin, with a password that no page may let out of its place.

form:  login page with a token, a cookie, an HTML table numbered from 1, changes that wait for "apply"
json:  digest, a list with numbers that stay
blind: basic, nothing to look at
"""
import base64
import hashlib
import html
import http.server
import json
import secrets
import socket
import ssl
import subprocess
import sys
import time
import urllib.parse

USER, PASSWORD = "admin", 'p&ss=1"\\{user}%0d\r\n'
FLAVOUR, FAULT, PORT = sys.argv[1], sys.argv[2], int(sys.argv[3])
NONCE = secrets.token_hex(8)
TABLE, COUNT = [], {}  # rows: dict of id, name, protocol, first, last, host, port
STATE = {"token": "", "cookie": None, "next": 1}
APPLIED = []  # what is in force of the table, by pages that apply


TABLE.append({"id": 0, "name": "tavo:another box", "protocol": "tcp", "first": 9999, "last": 9999,
              "host": "192.168.77.3", "port": 9999})


def program():
    """What the table says, into the packet filter."""
    script = "flush chain inet home prerouting_miniupnpd\nflush chain inet home miniupnpd\n"
    for row in TABLE:
        for protocol in ("tcp", "udp") if row["protocol"] == "both" else (row["protocol"],):
            for offset in range(row["last"] - row["first"] + 1):
                target = f"{row['host']}:{row['port'] + offset}"
                script += (f"add rule inet home prerouting_miniupnpd iifname wan0 {protocol} dport "
                           f"{row['first'] + offset} dnat ip to {target}\n"
                           f"add rule inet home miniupnpd {protocol} dport {row['port'] + offset} accept\n")
    subprocess.run(["nft", "-f", "-"], input=script, text=True, check=True)


def add(name, protocol, first, last, host, port):
    row = {"id": STATE["next"], "name": name[:31], "protocol": protocol.lower(), "first": int(first),
           "last": int(last), "host": host, "port": int(port)}
    clash = [r for r in TABLE if r["first"] <= row["last"] and row["first"] <= r["last"]
             and (r["protocol"] == row["protocol"] or "both" in (r["protocol"], row["protocol"]))]
    if clash:
        return False
    STATE["next"] += 1
    if FAULT != "lies":
        TABLE.append(row)
    return True


class Page(http.server.BaseHTTPRequestHandler):
    protocol_version = "HTTP/1.1"

    def log_message(self, *_):
        pass

    def answer(self, body, status=200, **headers):
        data = body.encode()
        self.send_response(status)
        for name, value in headers.items():
            self.send_header(name.replace("_", "-"), value)
        self.send_header("Content-Length", str(len(data)))
        self.end_headers()
        self.wfile.write(data)

    def do_any(self):
        path, _, query = self.path.partition("?")
        body = self.rfile.read(int(self.headers.get("Content-Length", 0))).decode()
        COUNT[path] = COUNT.get(path, 0) + 1
        if path == "/state":
            return self.answer(json.dumps({"table": TABLE, "count": COUNT}))
        if path == "/upnp":  # the pages list what was made by UPnP, too
            add(**json.loads(body))
            return self.answer("")
        if path == "/move":  # the box had another address when its forwards were made
            for row in TABLE[1:]:
                row["host"] = urllib.parse.parse_qs(body)["host"][0]
            return self.answer("")
        if FAULT == "hangs" or (FAULT == "hangs_on_add" and "add" in body):
            return time.sleep(600)
        if FAULT == "endless":
            self.send_response(200)
            self.end_headers()
            while True:
                self.wfile.write(b"x" * 65536)
        if FAULT == "redirects":
            return self.answer("", 302, Location=f"http://192.168.77.3:{PORT}{self.path}")
        return getattr(self, FLAVOUR)(path, dict(urllib.parse.parse_qsl(query)), body)

    do_GET = do_POST = do_DELETE = do_any

    # ---- form -------------------------------------------------------------------------------------

    def token(self):
        STATE["token"] = secrets.token_hex(16)
        name = "tkn" if FAULT == "changed" else "token"
        return f'<input type="hidden" name="{name}" value="{STATE["token"]}">'

    def form(self, path, _, body):
        fields = dict(urllib.parse.parse_qsl(body, keep_blank_values=True))
        if path == "/login.html":
            return self.answer(self.token())
        if fields.get("token", STATE["token"]) != STATE["token"]:
            return self.answer("token of another page", 403)
        if path == "/login.cgi":
            if (fields.get("username"), fields.get("password")) != (USER, PASSWORD):
                return self.answer("Wrong user name or password")
            STATE["cookie"] = secrets.token_hex(8)
            return self.answer("", 302, Location="/", Set_Cookie=f"session={STATE['cookie']}; HttpOnly")
        if STATE["cookie"] is None or f"session={STATE['cookie']}" not in self.headers.get("Cookie", ""):
            return self.answer("please log in", 302, Location="/login.html")
        if path == "/forward.html":
            rows = "".join(f"<tr><td>{i}</td><td>{html.escape(r['name'])}</td><td>{r['protocol'].upper()}</td>"
                           f"<td>{r['first']}</td><td>{r['last']}</td><td>{r['host']}</td><td>{r['port']}</td></tr>"
                           for i, r in enumerate(TABLE, 1))
            return self.answer(f"<h1>Port forwarding</h1>{self.token()}<table>{rows}</table>")
        if path == "/forward.cgi":
            if fields["action"] == "delete":
                del TABLE[int(fields["id"]) - 1]
            elif not add(*(fields[k] for k in ("name", "protocol", "first", "last", "host", "port"))):
                return self.answer("port in use" + self.token())
            return self.answer("saved" + self.token())
        if path == "/apply.cgi":
            program()
            return self.answer("applied")
        STATE["cookie"] = None  # logout
        return self.answer("bye")

    # ---- json -------------------------------------------------------------------------------------

    def digest(self):
        given = self.headers.get("Authorization", "")
        fields = {k: v.strip('"') for k, _, v in
                  (part.strip().partition("=") for part in given.removeprefix("Digest ").split(","))}
        def md5(text):
            return hashlib.md5(text.encode()).hexdigest()
        wanted = md5(":".join((md5(f"{USER}:router:{PASSWORD}"), NONCE, fields.get("nc", ""), fields.get("cnonce", ""),
                               "auth", md5(f"{self.command}:{self.path}"))))
        return fields.get("response") == wanted

    def json(self, path, _, body):
        if not self.digest():
            return self.answer("", 401, WWW_Authenticate=f'Digest realm="router", nonce="{NONCE}", qop="auth"')
        if self.command == "GET":
            return self.answer(json.dumps(TABLE))
        if self.command == "DELETE":
            TABLE[:] = [row for row in TABLE if str(row["id"]) != path.rpartition("/")[2]]
        elif not add(**json.loads(body)):
            return self.answer('{"error": "in use"}', 409)
        program()
        return self.answer("{}", 201)

    # ---- blind ------------------------------------------------------------------------------------

    def blind(self, path, query, _):
        account = base64.b64encode(f"{USER}:{PASSWORD}".encode()).decode()
        if self.headers.get("Authorization") != f"Basic {account}":
            return self.answer("", 401, WWW_Authenticate='Basic realm="router"')
        if path == "/add":
            done = add(**query)
        elif path == "/apply":
            done = FAULT != "applies_once" or COUNT[path] not in (2, 3)
            (APPLIED if done else TABLE)[:] = TABLE if done else APPLIED
        else:
            left = [r for r in TABLE if (r["protocol"], str(r["first"])) != (query["protocol"], query["first"])
                    or query.get("port", str(r["port"])) != str(r["port"])]
            if FAULT == "first_delete_fails" and COUNT[path] == 1:
                return self.answer("busy", 500)
            done = len(left) < len(TABLE)
            TABLE[:] = left
        program()
        if FAULT == "hangs_after_add" and path == "/add":
            return time.sleep(600)
        return self.answer("OK" if done else {"/add": "IN USE", "/apply": "FAILED"}.get(path, "NO SUCH RULE"))


class Server(http.server.ThreadingHTTPServer):
    address_family = socket.AF_INET
    daemon_threads = True

    def handle_error(self, *_):
        pass


server = Server(("", PORT), Page)
if len(sys.argv) > 4:
    context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)  # as old as many a router's
    context.set_ciphers("DEFAULT:@SECLEVEL=0")
    context.minimum_version = context.maximum_version = ssl.TLSVersion.TLSv1
    context.load_cert_chain(sys.argv[4])
    server.socket = context.wrap_socket(server.socket, server_side=True)
server.serve_forever()
