# A small scripted SMTP server for the testbed.
#
# Usage: smtpserver.py DIRECTORY
#
# Listens on 127.0.0.1:25 (inside the testbed's own network namespace) and
# answers a plain SMTP dialogue: 220 greeting, 250 to HELO, MAIL and RCPT, 354
# to DATA, 250 after the end of data, 221 to QUIT. Nothing is answered between
# DATA and the end of data, as a real server does. Each session is written to
# DIRECTORY/session-N.json once the client has closed the connection: the
# commands and data bytes received, in order, as text with the bytes kept
# exactly (latin-1), each with its CLOCK_MONOTONIC arrival time.
# "DIRECTORY/ready" appears once listening.
# A file DIRECTORY/replies.json may override the reply to a stage, e.g.
# {"greeting": "421 busy"}.

import json
import os
import socket
import sys
import threading
import time

# verb -> (stage, default reply)
ANSWERS = {"HELO": ("helo", "250 testbed"), "EHLO": ("helo", "250 testbed"), "MAIL": ("mail", "250 sender ok"),
           "RCPT": ("rcpt", "250 recipient ok"), "DATA": ("data", "354 go ahead"), "QUIT": ("quit", "221 bye")}


def serve(conn, directory, number, replies):
    record = {"commands": [], "data": None}
    buffer = b""

    def reply(stage, default):
        text = replies.get(stage, default)
        record["commands"].append({"sent": text, "at": time.monotonic()})
        conn.sendall(text.encode("latin-1") + b"\r\n")

    try:
        reply("greeting", "220 testbed ESMTP")
        in_data = False
        while True:
            chunk = conn.recv(65536)
            if not chunk:
                break
            buffer += chunk
            while True:
                if in_data:
                    end = buffer.find(b"\r\n.\r\n")
                    if end < 0:
                        break
                    record["data"] = buffer[:end + 2].decode("latin-1")
                    buffer = buffer[end + 5:]
                    in_data = False
                    reply("dataend", "250 queued")
                    continue
                end = buffer.find(b"\r\n")
                if end < 0:
                    break
                line = buffer[:end].decode("latin-1")
                buffer = buffer[end + 2:]
                record["commands"].append({"received": line, "at": time.monotonic()})
                verb = line.split(" ", 1)[0].split(":", 1)[0].upper()
                reply(*ANSWERS.get(verb, ("unknown", "500 unknown command")))
                in_data = verb == "DATA"
    except OSError as e:
        record["error"] = str(e)
    finally:
        record["unread"] = buffer.decode("latin-1")
        conn.close()
        path = os.path.join(directory, "session-%d.json" % number)
        with open(path + ".tmp", "w") as f:
            json.dump(record, f)
        os.rename(path + ".tmp", path)


def main():
    directory = sys.argv[1]
    replies_path = os.path.join(directory, "replies.json")
    replies = json.load(open(replies_path)) if os.path.exists(replies_path) else {}
    listener = socket.socket(socket.AF_INET, socket.SOCK_STREAM)
    listener.setsockopt(socket.SOL_SOCKET, socket.SO_REUSEADDR, 1)
    listener.bind(("127.0.0.1", 25))
    listener.listen(8)
    open(os.path.join(directory, "ready"), "w").close()
    number = 0
    while True:
        conn, _ = listener.accept()
        number += 1
        threading.Thread(target=serve, args=(conn, directory, number, replies), daemon=True).start()


if __name__ == "__main__":
    main()
