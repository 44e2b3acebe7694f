"""Whether forwarded ports can be reached: the port checker in the outside world, the tester on the box."""
import json
import os
import signal
import subprocess
import time
import unittest

import homelab
from homelab import BOX, BUILD, GATEWAY, HERE, LAN2, ROUTER_WAN, WAN, sh, wait_for

LAB = None
DISABLED, UNKNOWN, OPEN, REFUSED, TIMEOUT, NOLISTEN = range(6)
TOKEN = "0123456789abcdef-lab"
CONF = "/etc/tavo/portcheck.conf"
CHECKD = f"{BUILD}/programs/tavoportcheckd"
URL = f"http://{WAN}:8099"
WAN6 = "fd00:203::9"


def write_conf(mode=0o600, **keys):
    LAB.write(CONF, "[portcheck]\n" + "".join(f'{key}="{value}"\n' for key, value in
                                            ({"token": TOKEN, "per_address": 1000, "total": 9000} | keys).items()))
    os.chmod(CONF, mode)


def configure(url=URL, token=TOKEN, **keys):
    LAB.write("/etc/tavo/platform.conf", "[portcheck]\n" + "".join(
        f'{key}="{value}"\n' for key, value in ({"url": url, "token": token} | keys).items()))


def wait_for_port(host, address, port=8099):
    wait_for(lambda: LAB.run(host, f"/usr/bin/python3 -c 'import socket; "
                                   f"socket.create_connection((\"{address}\", {port}), 1)'",
                             check=False).returncode == 0, 10, f"somebody listens on {address}")


def start_checker(address=WAN, **keys):
    """Waits until it listens there."""
    write_conf(**keys)
    checker = LAB.start("wan", CHECKD)
    wait_for_port("wan", address)
    return checker


def program(host, code):
    """Python on a host that prints a line when it is ready."""
    process = LAB.start(host, "/usr/bin/python3", "-c", code, stdout=subprocess.PIPE)
    assert process.stdout.readline() == b"\n"
    return process


def listen(host, port, address="", family="INET", v6only=0):
    return program(host, f"import socket, signal; s = socket.socket(socket.AF_{family}); "
                         "s.setsockopt(socket.SOL_SOCKET, socket.SO_REUSEADDR, 1); "
                         f"{v6only} and s.setsockopt(41, 26, 1); s.bind(('{address}', {port})); s.listen(); "
                         "print(flush=True); signal.pause()")


def rules(*lines):
    text = ""
    for number, line in enumerate(lines, 1):
        enabled, protocol, router, box = line.split()
        text += (f'[{number}]\nenabled="{enabled}"\nr_port="{router}"\ns_port="{box}"\n'
                 f'protocol name="{protocol}"\nservice="s{number}"\n')
    LAB.write("/etc/portforward/rule.conf", text)


def test(*prefix, arguments=()):
    """Verdicts and texts."""
    out = LAB.run("box", " ".join(map(str, (*prefix, f"{BUILD}/tests/lab/porttester", *arguments)))).stdout
    return [tuple(entry) for entry in json.loads(out)]


def drop(host, protocol, port, hook, how="drop"):
    LAB.run(host, f"nft 'add table inet blocked; add chain inet blocked {hook} {{ type filter hook {hook} "
                  f"priority -5; }}; add rule inet blocked {hook} {protocol} dport {port} {how}'")


class Rules(unittest.TestCase):
    """Verdicts, through a real router."""

    def setUp(self):
        LAB.clear_state()
        LAB.start_router()
        configure()
        self.processes = [start_checker()]

    def tearDown(self):
        for process in self.processes:
            LAB.end(process)
            if process.stdout:
                process.stdout.close()
        for host in ("box", "router"):
            LAB.run(host, "nft delete table inet blocked", check=False)
        LAB.stop_router()

    def serve(self, *arguments, **kwargs):
        self.processes.append(listen(*arguments, **kwargs))

    def map(self, *ports, protocol="TCP"):
        for port in ports:
            LAB.run("box", f"upnpc -u http://{GATEWAY}:5000/rootDesc.xml -a {BOX} {port} {port} {protocol}")

    def check(self, cases, *prefix):
        rules(*(rule for rule, _, _ in cases))
        for (rule, status, reason), found in zip(cases, test(*prefix), strict=True):
            with self.subTest(rule):
                self.assertEqual(found[0], status, found)
                self.assertIn(reason, found[1])

    def test_each_trouble_is_told_apart(self):
        for port in (5001, 5003, 5004, 5005, 5006):
            self.serve("box", port)
        self.serve("box", 5008, "127.0.0.1")
        self.serve("box", 5009, "::", "INET6", 1)
        self.serve("box", 5010, "::", "INET6")
        self.serve("lan2", 5004)
        self.processes.append(program("box", "import socket, signal; s = socket.socket(2, 2); s.bind(('', 6003)); "
                                             "print(flush=True); signal.pause()"))
        self.map(5001, 5002, 5003, 5006, 5008, 5009, 5010)
        self.map(6001, 6002, 6003, protocol="UDP")
        LAB.map_foreign(5004)
        drop("router", "tcp", 5003, "forward")
        drop("router", "udp", 6002, "forward")
        drop("box", "tcp", 5006, "prerouting")
        drop("router", "tcp", 5011, "input", "reject with icmpx admin-prohibited")
        start = time.monotonic()
        cases = (
            ("1 tcp 5001 5001", OPEN, "5001/tcp: open"),
            ("1 tcp 5002 5002", NOLISTEN, "5002/tcp: nobody listens on port 5002 of this box"),
            ("1 tcp 5003 5003", TIMEOUT, "nothing came to this box"),
            ("1 tcp 5004 5004", REFUSED, "5004/tcp: another host answers"),
            ("1 tcp 5005 5005", REFUSED, "the router does not pass it on"),
            ("1 tcp 5006 5006", TIMEOUT, "the request came to this box"),
            ("1 tcp 5008 5008", NOLISTEN, "nobody listens"),
            ("1 tcp 5009 5009", NOLISTEN, "nobody listens"),
            ("1 tcp 5010 5010", OPEN, "open"),
            ("1 tcp 5011 5001", REFUSED, "rejected by a router or firewall"),
            ("0 tcp 5001 5001", DISABLED, "disabled"),
            ("1 udp 6001 6001", OPEN, "6001/udp: open"),
            ("1 udp 6002 6002", TIMEOUT, "though other UDP did"),
            ("1 udp 6003 6003", UNKNOWN, "a program has port 6003"),
            ("1 udp 6004 6004", REFUSED, "refused before it came to this box"),
            ("1 tcp 5001-5003 5001-5003", TIMEOUT, "5002/tcp: nobody listens on port 5002 of this box; 5001/tcp: open"),
            ("1 tcp 5001-5003 5001", UNKNOWN, "paired"))
        self.check(cases)
        self.assertLess(time.monotonic() - start, 12)
        by_library = {OPEN: 2, REFUSED: 3, TIMEOUT: 3, DISABLED: 1, UNKNOWN: 0, NOLISTEN: 0}
        self.assertEqual([status for status, _ in test(arguments=("library",))],
                         [by_library[status] for _, status, _ in cases])

    def test_without_privileges_what_cannot_be_told_is_unknown(self):
        self.serve("box", 5001)
        self.serve("box", 5004)
        self.serve("lan2", 5004)
        self.map(5001)
        LAB.map_foreign(5004)
        self.check((("1 tcp 5001 5001", OPEN, "open"), ("1 tcp 5004 5004", UNKNOWN, "cannot be told"),
                    ("1 tcp 5005 5005", NOLISTEN, "nobody")), "setpriv --bounding-set -net_raw")

    def test_silence_by_udp_proves_nothing_by_itself(self):
        self.map(6002, protocol="UDP")
        drop("router", "udp", 6002, "forward")
        self.check((("1 udp 6002 6002", UNKNOWN, "is not known"),))

    def test_a_listener_of_its_own_knows_whether_it_was_called(self):
        self.map(5002, 5003)
        drop("router", "tcp", 5003, "forward")
        LAB.map_foreign(5004)
        self.processes.append(LAB.start("lan2", "/usr/bin/python3", f"{HERE}/echo.py", "serve", "5004"))
        wait_for_port("lan2", LAN2, 5004)
        for port, status in ((5002, OPEN), (5003, TIMEOUT), (5004, REFUSED), (5005, REFUSED)):
            self.assertEqual(test(arguments=("own", "TCP", port, port))[0][0], status, port)

    def test_a_checker_behind_a_web_server_with_tls(self):
        self.serve("box", 5001)
        self.map(5001)
        LAB.end(self.processes.pop(0))
        self.processes.append(start_checker("127.0.0.1", listen="127.0.0.1:8099", trusted_proxies="127.0.0.1"))
        sh(f"openssl req -x509 -newkey rsa:2048 -nodes -days 2 -subj /CN=checker -addext subjectAltName=IP:{WAN} "
           "-keyout /tmp/checker.pem -out /tmp/checker.crt && cat /tmp/checker.crt >>/tmp/checker.pem")
        self.processes.append(LAB.start("wan", "/usr/bin/python3", f"{HERE}/tls_front.py", WAN, "/tmp/checker.pem",
                                        stderr=subprocess.DEVNULL))
        wait_for_port("wan", WAN, 8443)
        configure(url=f"https://{WAN}:8443/check/")
        self.check((("1 tcp 5001 5001", UNKNOWN, "its certificate"),))
        sh("mkdir -p /etc/ssl/certs && cat /tmp/checker.crt >>/etc/ssl/certs/ca-certificates.crt")
        self.check((("1 tcp 5001 5001", OPEN, "open"),))

    def test_more_ports_than_one_request_or_one_test_takes(self):
        self.serve("box", 5001)
        self.map(5001)
        configure(ports_per_request=2, max_ports=5)
        self.check((("1 tcp 5001 5001", OPEN, "open"),) * 5 + (("1 tcp 5001 5001", UNKNOWN, "max_ports"),))
        configure(ports_per_request=80)
        self.check((("1 tcp 5001 5001", UNKNOWN, "HTTP 400"),) * 65)

    def test_a_checker_that_is_there_for_ipv6_only(self):
        sh(f"ip -n box addr add fd77::2/64 dev box0 nodad && ip -n router addr add fd77::1/64 dev br0 nodad && "
           f"ip -n router addr add fd00:203::2/64 dev wan0 nodad && ip -n wan addr add {WAN6}/64 dev out0 nodad && "
           "ip -n box route add default via fd77::1 && ip -n wan route add fd77::/64 via fd00:203::2")
        LAB.run("router", "sysctl -qw net.ipv6.conf.all.forwarding=1")
        LAB.end(self.processes.pop(0))
        self.processes.append(start_checker(WAN6, listen="[::]:8099"))
        wait_for_port("box", WAN6)  # it is there, and would test the wrong family
        self.serve("box", 5001)
        for url in (URL, f"http://[{WAN6}]:8099"):
            configure(url=url)
            self.check((("1 tcp 5001 5001", UNKNOWN, "cannot be reached by IPv4"), ("1 udp 5002 5002", UNKNOWN, "cannot be reached by IPv4"),
                        ("1 tcp 5003 5003", NOLISTEN, "nobody listens")))


class Checker(unittest.TestCase):
    """The checker against clients of every kind."""

    def setUp(self):
        self.checker = None
        configure()

    def tearDown(self):
        if self.checker:
            LAB.end(self.checker)

    def start(self, **keys):
        self.tearDown()
        self.checker = start_checker(**keys)

    def ask(self, host="box", ports=1, url=URL, token=TOKEN, body=None, **headers):
        """Status and answer."""
        body = body if body is not None else json.dumps({"version": 1, "probe": "0" * 32, "answer": "1" * 32, "ports": [
            {"protocol": "tcp", "port": 7000 + i, "challenge": False} for i in range(ports)]})
        headers = {"Authorization": f"Bearer {token}", "Content-Type": "application/json"} | {
            key.replace("_", "-"): value for key, value in headers.items()}
        out = LAB.run(host, "curl -gs -m 20 -w '\\n%{http_code}' -X POST --data-binary @- "
                      + " ".join(f"-H '{key}: {value}'" for key, value in headers.items()) + f" '{url}/v1/ports'",
                      check=False, input=body).stdout
        answer, _, status = out.rpartition("\n")
        return int(status), json.loads(answer) if answer else None

    def test_requests_that_are_not_served(self):
        self.start(max_ports=4)
        good = {"version": 1, "probe": "0" * 32, "answer": "1" * 32,
                "ports": [{"protocol": "tcp", "port": 7000, "challenge": False}]}
        port = good["ports"][0]
        bad = [{"version": 2}, {"version": "1"}, {"probe": "0" * 31}, {"probe": "A" * 32}, {"answer": 1}, {"ports": []},
               {"ports": {}}, {"ports": [7000]}, {"ports": [port | {"port": 0}]}, {"ports": [port | {"port": 65536}]},
               {"ports": [port | {"port": "70"}]}, {"ports": [port | {"protocol": "sctp"}]}, {"ports": [port] * 5}]
        for change in bad:
            with self.subTest(change):
                self.assertEqual(self.ask(body=json.dumps(good | change))[0], 400)
        for body in ("", "[]", "[" * 20000, json.dumps(good) + "x", '{"version":1,' + json.dumps(good)[1:]):
            self.assertEqual(self.ask(body=body)[0], 400, body[:20])
        self.assertEqual(self.ask(body=json.dumps(good))[0], 200)
        self.assertEqual(self.ask(body=" " * 25000)[0], 413)
        self.assertEqual(self.ask(token=TOKEN[:-1])[0], 401)
        self.assertEqual(self.ask(token=TOKEN[:-1] + "x")[0], 401)
        self.assertEqual(self.ask(Content_Type="text/plain")[0], 415)
        self.assertEqual(self.ask(Content_Encoding="gzip")[0], 415)
        self.assertEqual(self.ask(**{f"X_{i}": "y" for i in range(50)})[0], 431)
        self.assertEqual(self.ask(url=f"{URL}/other")[0], 404)

    def test_clients_that_take_their_time_or_never_end_are_left(self):
        self.start()
        for head, trickle in (("", "x"), ("POST /v1/ports HTTP/1.1\\r\\n", "A: b\\r\\n"),
                              ("POST /v1/ports HTTP/1.1\\r\\nTransfer-Encoding: chunked\\r\\nContent-Type: "
                               f"application/json\\r\\nAuthorization: Bearer {TOKEN}\\r\\n\\r\\n", "1\\r\\n{\\r\\n")):
            for pause, seconds in ((0.5, 9), (0, 5)):
                with self.subTest(head=head, pause=pause):
                    start = time.monotonic()
                    LAB.run("box", f"/usr/bin/python3 -c \"import socket, time\ns = socket.create_connection(('{WAN}', "
                                   f"8099))\ns.sendall(b'{head}')\ntry:\n while True:\n  s.sendall(b'{trickle}' * {1 if pause else 1000})\n  "
                                   f"time.sleep({pause})\nexcept OSError:\n pass\"", timeout=15)
                    self.assertLess(time.monotonic() - start, seconds)
        self.assertEqual(self.ask()[0], 200)

    def test_it_connects_to_the_one_that_asks_and_to_nobody_else(self):
        self.start(listen=f"{WAN}:8099 127.0.0.1:8099 [::1]:8099", trusted_proxies="127.0.0.1")
        told = {"X_Forwarded_For": "203.0.113.77", "X_Real_IP": "203.0.113.77", "Forwarded": "for=203.0.113.77"}
        self.assertEqual(self.ask(**told)[1]["address"], ROUTER_WAN)
        self.assertEqual(self.ask(host="wan")[1]["address"], WAN)
        self.assertEqual(self.ask(host="wan", url="http://[::1]:8099", **told)[1]["address"], "::1")
        for header, address in (("203.0.113.2", ROUTER_WAN), ("9.9.9.9, 203.0.113.2", ROUTER_WAN),
                                ("127.0.0.1, ::ffff:203.0.113.2", ROUTER_WAN), (None, None), ("", None), ("x", None),
                                ("203.0.113.2, 127.0.0.1", None), ("::1", None), (WAN, None), ("0.0.0.0", None),
                                ("::ffff:127.0.0.1", None), ("169.254.1.1", None), ("255.255.255.255", None),
                                ("ff02::1", None), ("203.0.113.2:80", None)):
            with self.subTest(header):
                headers = {} if header is None else {"X_Forwarded_For": header}
                status, answer = self.ask(host="wan", url="http://127.0.0.1:8099", **headers)
                self.assertEqual(status, 200 if address else 400)
                self.assertEqual(answer.get("address"), address)

    def test_limits(self):
        self.start(per_address=3, total=5)
        self.assertEqual([self.ask()[0] for _ in range(5)], [200, 200, 200, 429, 429])
        self.assertEqual([self.ask(host="wan", token="wrong")[0] for _ in range(3)], [401, 401, 429])

    def test_a_stop_cuts_what_is_under_way(self):
        self.start()
        drop("router", "tcp", 7000, "prerouting")
        try:
            asking = LAB.start("box", f"{BUILD}/tests/lab/porttester", "own", "TCP", "7000", "7000",
                               stdout=subprocess.PIPE)
            wait_for(lambda: "7000" in LAB.run("wan", "ss -Htn state syn-sent").stdout, 5, "it is under way")
            start = time.monotonic()
            self.checker.send_signal(signal.SIGTERM)
            self.assertEqual(self.checker.wait(timeout=5), 0)
            self.assertLess(time.monotonic() - start, 1.5)
            self.assertEqual(json.loads(asking.communicate(timeout=15)[0])[0][0], UNKNOWN)
        finally:
            LAB.run("router", "nft delete table inet blocked")

    def test_configurations_that_are_none(self):
        for reason, mode, keys in (("other users", 0o644, {}), ("token", 0o600, {"token": "short"}),
                                   ("token", 0o600, {"token": ""}), ("listen", 0o600, {"listen": "8099"}),
                                   ("listen", 0o600, {"listen": "0.0.0.0:0"}), ("trusted", 0o600, {"trusted_proxies": "x"}),
                                   ("bounds", 0o600, {"at_once": 0}), ("bounds", 0o600, {"total": "1x"})):
            write_conf(mode, **keys)
            result = LAB.run("wan", CHECKD, check=False, timeout=5)
            self.assertEqual((result.returncode, reason in result.stderr), (1, True), result)


if __name__ == "__main__":
    homelab.run_tests(lambda _: None)
