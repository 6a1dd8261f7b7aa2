"""A server that speaks TLS: tls_server.py CERTIFICATE KEY PORT_FILE BODY_FILE

Takes connections on this machine one after the other, appends what it can decrypt to
BODY_FILE and answers each request with 200. Writes its port to PORT_FILE once it listens.
"""

import os
import re
import socket
import ssl
import sys

certificate, key, port_file, body_file = sys.argv[1:]
context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
context.load_cert_chain(certificate, key)
listener = socket.create_server(("127.0.0.1", 0))
open(body_file, "wb").close()
with open(port_file + ".new", "w", encoding="ascii") as file:
    file.write(str(listener.getsockname()[1]))
os.rename(port_file + ".new", port_file)


def is_whole(request):
    head, end, body = request.partition(b"\r\n\r\n")
    length = re.search(rb"Content-Length: (\d+)", head)
    return end and length and len(body) >= int(length.group(1))


while True:
    connection, _ = listener.accept()
    try:
        with context.wrap_socket(connection, server_side=True) as peer:
            request = b""
            while not is_whole(request):
                received = peer.recv(65536)
                if not received:
                    break
                request += received
                with open(body_file, "ab") as file:
                    file.write(received)
            peer.sendall(b"HTTP/1.1 200 OK\r\nContent-Length: 2\r\n"
                         b"Connection: close\r\n\r\n{}")
    except (ssl.SSLError, OSError):
        pass
