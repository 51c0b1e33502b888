"""A real SMTP server on loopback for the alert delivery test.

Serves the SMTP protocol of python3-aiosmtpd on 127.0.0.1 at a port the
system picks, prints that port on the first line of standard output, and
stores every accepted message in the given folder: the envelope sender, one
line per envelope recipient, a blank line, then the data exactly as the
server took it (transparency dots removed).
"""
import asyncio
import os
import sys

from aiosmtpd.smtp import SMTP


class Store:
    def __init__(self, folder):
        self.folder = folder
        self.count = 0

    async def handle_DATA(self, server, session, envelope):
        self.count += 1
        path = os.path.join(self.folder, "message%d" % self.count)
        with open(path + ".part", "wb") as out:
            out.write(("MAIL FROM:%s\n" % envelope.mail_from).encode())
            for recipient in envelope.rcpt_tos:
                out.write(("RCPT TO:%s\n" % recipient).encode())
            out.write(b"\n")
            out.write(envelope.original_content)
        os.rename(path + ".part", path)
        return "250 2.0.0 Ok: stored"


async def main():
    loop = asyncio.get_running_loop()
    server = await loop.create_server(lambda: SMTP(Store(sys.argv[1])), "127.0.0.1", 0)
    print(server.sockets[0].getsockname()[1], flush=True)
    await server.serve_forever()


asyncio.run(main())
