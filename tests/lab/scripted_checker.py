"""A port checker with faults: takes every request and does not answer it as one. Argument: the fault."""
import socket
import sys
import time


def answer(body, status="200 OK"):
    return f"HTTP/1.1 {status}\r\nContent-Length: {len(body)}\r\n\r\n{body}".encode()


ANSWERS = {
    "silence": b"",
    "noise": b"\x00\xff nothing of the kind \r\n" * 50,
    "html": answer("<html>captive portal</html>"),
    "elsewhere": b"HTTP/1.1 302 Found\r\nLocation: http://192.168.77.1/\r\nContent-Length: 0\r\n\r\n",
    "version": answer('{"version":2,"address":"203.0.113.2","results":[]}'),
    "six": answer('{"version":1,"address":"2001:db8::2","results":[]}'),
    "few": answer('{"version":1,"address":"203.0.113.2","results":[]}'),
    "flood": b"HTTP/1.1 200 OK\r\nContent-Length: 99999999\r\n\r\n" + b"x" * 2000000,
}

if __name__ == "__main__":
    listener = socket.socket()
    listener.setsockopt(socket.SOL_SOCKET, socket.SO_REUSEADDR, 1)
    listener.bind(("", 8099))
    listener.listen()
    while True:
        client, _ = listener.accept()
        try:
            client.recv(65536)
            client.sendall(ANSWERS[sys.argv[1]])
            time.sleep(30 if sys.argv[1] == "silence" else 0)
        except OSError:
            pass
        client.close()
