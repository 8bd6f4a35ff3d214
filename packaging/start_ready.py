#!/usr/bin/env python3
"""start_ready.py LOG ADDRESS COMMAND...: starts COMMAND as a service manager would for a
Type=notify unit (NOTIFY_SOCKET set, output to LOG), waits for its READY=1 and checks that
ADDRESS (a Unix socket path, HOST:PORT, or "-" for none) already takes connections then.
Prints the daemon's pid and leaves it running; exits 1 when it died or stayed silent for 60 s.
"""
import os
import socket
import subprocess
import sys
import tempfile
import time


def connects(address):
    if address == "-":
        return True
    if address.startswith("/"):
        family, target = socket.AF_UNIX, address
    else:
        host, port = address.rsplit(":", 1)
        family, target = socket.AF_INET, (host, int(port))
    with socket.socket(family, socket.SOCK_STREAM) as s:
        try:
            s.connect(target)
            return True
        except OSError:
            return False


def main():
    log, address, command = sys.argv[1], sys.argv[2], sys.argv[3:]
    with tempfile.TemporaryDirectory() as scratch:
        path = os.path.join(scratch, "notify")
        manager = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
        manager.bind(path)
        env = dict(os.environ, NOTIFY_SOCKET=path)
        with open(log, "ab") as out:
            daemon = subprocess.Popen(command, env=env, stdout=out, stderr=out,
                                      start_new_session=True)
        deadline = time.monotonic() + 60
        while time.monotonic() < deadline:
            manager.settimeout(0.2)
            try:
                message = manager.recv(4096).decode()
            except socket.timeout:
                if daemon.poll() is not None:
                    print(f"{command[0]} exited with {daemon.returncode} before it was ready",
                          file=sys.stderr)
                    return 1
                continue
            if "READY=1" in message.split("\n"):
                if not connects(address):
                    print(f"{command[0]} said it was ready before {address} took connections",
                          file=sys.stderr)
                    daemon.kill()
                    return 1
                print(daemon.pid)
                return 0
        print(f"{command[0]} sent no READY=1 within 60 s", file=sys.stderr)
        daemon.kill()
        return 1


if __name__ == "__main__":
    sys.exit(main())
