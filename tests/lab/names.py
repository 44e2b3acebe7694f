"""A name server that knows one address for every name.  Usage: names.py ADDRESS"""
import socket
import sys

ADDRESS = sys.argv[1]

sock = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
sock.bind(("", 53))
print("ready", flush=True)
while True:
    query, peer = sock.recvfrom(1500)
    end = query.index(b"\0", 12) + 5
    is_a = query[end - 4:end - 2] == b"\0\1"
    answer = b"\xc0\x0c\0\1\0\1\0\0\0\x3c\0\4" + socket.inet_aton(ADDRESS) if is_a else b""
    sock.sendto(query[:2] + b"\x81\x80\0\1" + (b"\0\1" if is_a else b"\0\0") + b"\0\0\0\0" + query[12:end] + answer, peer)
