#!/usr/bin/env python3
"""Socket activation as systemd does it, for machines without systemd-socket-activate: listens
on a Unix socket, waits for the first connection, then runs the program with the listening
socket as fd 3 and LISTEN_FDS=1, LISTEN_PID set.

usage: activate.py SOCKET PROGRAM [ARG...]"""
import os
import select
import socket
import sys

path, program = sys.argv[1], sys.argv[2:]
listener = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
listener.bind(path)
listener.listen(64)
print(f"Listening on {path}", file=sys.stderr, flush=True)
select.select([listener], [], [])
os.dup2(listener.fileno(), 3)
os.set_inheritable(3, True)  # dup2 onto itself keeps close-on-exec
os.environ.update(LISTEN_FDS="1", LISTEN_PID=str(os.getpid()))
os.execv(program[0], program)
