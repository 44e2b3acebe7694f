"""An echo server for TCP and UDP, and the client that tells whether it answers (exit status 0)."""
import selectors
import socket
import sys


def serve(ports):
    waiting = selectors.DefaultSelector()
    for port in ports:
        for kind in (socket.SOCK_STREAM, socket.SOCK_DGRAM):
            sock = socket.socket(socket.AF_INET, kind)
            sock.setsockopt(socket.SOL_SOCKET, socket.SO_REUSEADDR, 1)
            sock.bind(("", port))
            if kind == socket.SOCK_STREAM:
                sock.listen()
            waiting.register(sock, selectors.EVENT_READ)
    while True:
        for key, _ in waiting.select():
            sock = key.fileobj
            if sock.type == socket.SOCK_DGRAM:
                data, peer = sock.recvfrom(100)
                sock.sendto(data, peer)
            else:
                client, _ = sock.accept()
                client.settimeout(2)
                client.sendall(client.recv(100))
                client.close()


def ask(kind, host, port):
    sock = socket.socket(socket.AF_INET, kind)
    sock.settimeout(1)
    try:
        sock.connect((host, port))
        sock.send(b"hello")
        return sock.recv(100) == b"hello"
    except OSError:
        return False


if __name__ == "__main__":
    if sys.argv[1] == "serve":
        serve([int(port) for port in sys.argv[2:]])
    kind = {"tcp": socket.SOCK_STREAM, "udp": socket.SOCK_DGRAM}[sys.argv[1]]
    sys.exit(0 if ask(kind, sys.argv[2], int(sys.argv[3])) else 1)
