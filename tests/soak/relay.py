"""Carries a session between its standard input and output and a Unix socket, in pieces of odd sizes, as a network does.

    relay.py SOCKET
"""

import itertools
import os
import socket
import sys
import threading

SIZES = (1, 23, 24, 25, 1000, 65_536, 7, 4096, 131_071)


def write_all(fd, piece):
    while piece:
        piece = piece[os.write(fd, piece):]


def carry(source, target):
    for size in itertools.cycle(SIZES):
        piece = os.read(source, size)
        if not piece:
            return
        write_all(target, piece)


def main():
    connection = socket.socket(socket.AF_UNIX)
    connection.connect(sys.argv[1])

    def to_engine():
        carry(0, connection.fileno())
        connection.shutdown(socket.SHUT_WR)

    threading.Thread(target=to_engine, daemon=True).start()
    carry(connection.fileno(), 1)


if __name__ == "__main__":
    main()
