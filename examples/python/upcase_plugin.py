#!/usr/bin/python3
"""A plug-in program in Python, as the supervisor starts it: it answers the
host on the socket named by TENON_PLUGIN_SOCKET, one line for each line,
upper-cased, and is busy while it works. "hold" and "release" declare it
busy and idle until told otherwise (what a long task would do).

Its bundle carries tenon_client.py beside it (bin/), which it imports."""
import os
import sys

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))
import tenon_client  # noqa: E402


def answer(instance, line):
    if line == "hold":
        instance.declare_busy()
        return "busy"
    if line == "release":
        instance.declare_idle()
        return "idle"
    instance.declare_busy()
    try:
        return line.upper()
    finally:
        instance.declare_idle()


def main():
    try:
        instance = tenon_client.PlugInInstance()
    except tenon_client.MissingCbor2 as missing:
        sys.exit(f"upcase_plugin: {missing}")
    host = instance.host_socket()
    if host is None:
        sys.exit("upcase_plugin: TENON_PLUGIN_SOCKET names no socket; the supervisor starts this program")
    with host, host.makefile("rw", encoding="utf-8", newline="\n") as stream:
        for line in stream:
            stream.write(answer(instance, line.rstrip("\n")) + "\n")
            stream.flush()
    instance.close()


if __name__ == "__main__":
    main()
