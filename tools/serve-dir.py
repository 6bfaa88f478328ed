#!/usr/bin/env python3
"""Serves one directory over HTTP on 127.0.0.1 for the demonstration.

Binds an ephemeral port, writes it to the file given as the second argument,
and serves until terminated.
"""
import functools
import http.server
import sys


class QuietHandler(http.server.SimpleHTTPRequestHandler):
    def log_message(self, *args):
        pass


def main():
    directory, port_file = sys.argv[1], sys.argv[2]
    handler = functools.partial(QuietHandler, directory=directory)
    with http.server.ThreadingHTTPServer(("127.0.0.1", 0), handler) as server:
        with open(port_file + ".tmp", "w") as f:
            f.write(str(server.server_address[1]))
        import os
        os.replace(port_file + ".tmp", port_file)
        server.serve_forever()


if __name__ == "__main__":
    main()
