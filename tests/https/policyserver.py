#!/usr/bin/env python3
"""A stand-in for the network configuration web service, for the HTTPS client's tests and
the demo: a TLS server that requires a client certificate chained to a given CA and answers
every GET with the status and body it was told to, in one piece or in chunks. It stops by
itself after a number of requests or a time limit, whichever comes first.

It writes --ready once it listens, and appends one JSON line per request to --log with the
path and the client certificate's common name."""

import argparse
import http.server
import json
import os
import ssl
import sys
import time


def parse_args():
    p = argparse.ArgumentParser()
    p.add_argument("--port", type=int, required=True)
    p.add_argument("--cert", required=True, help="server certificate (PEM)")
    p.add_argument("--key", required=True, help="server key (PEM)")
    p.add_argument("--client-ca", required=True, help="CA the client certificate must chain to")
    p.add_argument("--status", type=int, default=200)
    p.add_argument("--body", default=None, help="body text")
    p.add_argument("--body-file", default=None, help="body read from this file")
    p.add_argument("--pad-to", type=int, default=0,
                   help="body: an object padded to exactly this many bytes")
    p.add_argument("--chunks", type=int, default=0,
                   help="send the body chunked, in this many pieces (0: Content-Length)")
    p.add_argument("--requests", type=int, default=1, help="stop after this many requests")
    p.add_argument("--lifetime", type=float, default=60.0, help="stop after this many seconds")
    p.add_argument("--ready", default=None, help="file written once the server listens")
    p.add_argument("--log", default=None, help="file that gets one JSON line per request")
    return p.parse_args()


def make_body(args):
    if args.pad_to:
        head = '{"Enabled":"true","Pad":"'
        tail = '"}'
        return (head + "x" * max(0, args.pad_to - len(head) - len(tail)) + tail).encode()
    if args.body_file:
        with open(args.body_file, "rb") as f:
            return f.read()
    if args.body is not None:
        return args.body.encode()
    return b'{"Enabled":"true","RelayFQDN":"localhost","RelayPort":47150,"NumPackets":10,' \
           b'"MaxTestDay":24,"Policy":"BattAC","DurationValid":"P1D"}'


def split(body, pieces):
    size = max(1, -(-len(body) // pieces))
    return [body[i:i + size] for i in range(0, len(body), size)] or [b""]


def detach():
    """Wine starts this program with the test process's own standard handles and whatever
    else it inherited: keeping them open would hold CTest's output pipe until the server
    ends, and the test would seem to last as long as the server lives."""
    devnull = os.open(os.devnull, os.O_RDWR)
    for fd in (0, 1, 2):
        os.dup2(devnull, fd)
    os.closerange(3, 256)


def main():
    args = parse_args()
    detach()
    body = make_body(args)
    served = [0]

    class Handler(http.server.BaseHTTPRequestHandler):
        protocol_version = "HTTP/1.1"

        def log_message(self, fmt, *a):
            pass

        def do_GET(self):
            served[0] += 1
            cert = self.connection.getpeercert() or {}
            cn = ""
            for rdn in cert.get("subject", ()):
                for key, value in rdn:
                    if key == "commonName":
                        cn = value
            if args.log:
                with open(args.log, "a") as f:
                    f.write(json.dumps({"path": self.path, "method": self.command,
                                        "client": cn,
                                        "contentType": self.headers.get("Content-Type", "")})
                            + "\n")
            self.send_response(args.status)
            self.send_header("Content-Type", "application/json")
            # One request per connection: a client that kept it open would hold the
            # single-threaded server until the connection timed out.
            self.send_header("Connection", "close")
            self.close_connection = True
            if args.chunks:
                self.send_header("Transfer-Encoding", "chunked")
                self.end_headers()
                self.wfile.flush()
                for piece in split(body, args.chunks):
                    self.wfile.write(b"%x\r\n%s\r\n" % (len(piece), piece))
                    self.wfile.flush()
                    # Give each piece its own TLS record and read on the client.
                    time.sleep(0.05)
                self.wfile.write(b"0\r\n\r\n")
            else:
                self.send_header("Content-Length", str(len(body)))
                self.end_headers()
                self.wfile.write(body)
            self.wfile.flush()

    context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
    context.load_cert_chain(args.cert, args.key)
    context.verify_mode = ssl.CERT_REQUIRED
    context.load_verify_locations(args.client_ca)

    class Server(http.server.HTTPServer):
        def get_request(self):
            # The handshake runs here, bounded, so a silent client cannot hold the server;
            # a failed one (an untrusted or missing client certificate) is an OSError,
            # which drops that connection only.
            raw, address = self.socket.accept()
            raw.settimeout(10)
            return context.wrap_socket(raw, server_side=True), address

    Handler.timeout = 10
    server = Server(("127.0.0.1", args.port), Handler)
    server.timeout = 0.25
    server.handle_error = lambda request, address: None
    if args.ready:
        tmp = args.ready + ".tmp"
        with open(tmp, "w") as f:
            f.write(str(os.getpid()))
        os.replace(tmp, args.ready)
    deadline = time.monotonic() + args.lifetime
    while served[0] < args.requests and time.monotonic() < deadline:
        server.handle_request()
    server.server_close()


if __name__ == "__main__":
    sys.exit(main())
