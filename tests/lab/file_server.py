"""A download server with faults. Usage: file_server.py DIRECTORY PORT. The first part of a path chooses how
the rest of it is served: good, half (dies in the middle), endless, stalls, missing, portal (a web page)."""
import http.server
import os
import sys
import time


class Handler(http.server.BaseHTTPRequestHandler):
    def log_message(self, *_):
        pass

    def do_GET(self):
        fault, _, name = self.path.lstrip("/").partition("/")
        path = os.path.join(sys.argv[1], os.path.basename(name))
        if fault == "missing" or not os.path.exists(path):
            return self.send_error(404)
        with open(path, "rb") as file:
            data = file.read()
        if fault == "portal":
            data = b"\n <!DOCTYPE html><html>Please log in</html>"
        self.send_response(200)
        if fault != "endless":
            self.send_header("Content-Length", str(len(data)))
        self.end_headers()
        if fault == "half":
            data = data[:len(data) // 2]
        self.wfile.write(data if fault != "stalls" else b"")
        while fault == "endless":
            self.wfile.write(bytes(1 << 20))
        if fault == "stalls":
            time.sleep(600)


http.server.ThreadingHTTPServer(("", int(sys.argv[2])), Handler).serve_forever()
