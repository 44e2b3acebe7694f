"""Takes a report as the server of reports does: keeps what was uploaded, and who said what of it."""
import json
import os
import sys

PLACE = os.environ["REPORT_PLACE"]
body = sys.stdin.buffer.read(int(os.environ["CONTENT_LENGTH"]))
boundary = b"\r\n--" + os.environ["CONTENT_TYPE"].split("boundary=")[1].encode()
nothing, part, end = (b"\r\n" + body).split(boundary)
head, _, data = part.partition(b"\r\n\r\n")
with open(f"{PLACE}/report.tgz", "wb") as file:
    file.write(data)
with open(f"{PLACE}/report.json", "w", encoding="utf-8") as file:
    json.dump({"user": os.environ["REMOTE_USER"], "head": head.decode().strip().split("\r\n")}, file)
print("Status: 200\r\nContent-Type: text/plain\r\n\r\nthanks")
