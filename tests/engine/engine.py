#!/usr/bin/python3
"""A scripting engine for tests whose script (its second argument) is Python: for messages that no list of moves can say.

Copied or linked into a directory as ox_script.bin it runs the script with these names defined:

    send(command, first=b"", second=b"")  writes one message with one write, padded to the shortest that is answered
    raw(data)                             writes these bytes with one write
    answer()                              reads one answer: (status, text)
    call(command, first, second)          send and answer
    body(count=None)                      reads the input: `count` bytes, or as many as the seventh argument says
    output(data)                          appends to the output file (fourth argument)
    args                                  the arguments, args[0] being the engine itself
    say_exit()                            writes EXIT

Texts are bytes; str is taken as UTF-8. The engine ends with code 0 after the script, with 90 when the script raised
something (the traceback is on standard error), and as the script says where that calls sys.exit or os._exit.
"""

import os
import signal
import struct
import sys
import time
import traceback

SHORTEST_MESSAGE = 9
FAILED = 90
STDIN, STDOUT = 0, 1

args = [os.fsdecode(argument) for argument in sys.argv]


def to_bytes(text):
    return text.encode() if isinstance(text, str) else bytes(text)


def raw(data):
    data = to_bytes(data)
    written = os.write(STDOUT, data)
    if written != len(data):
        raise OSError(f"only {written} of {len(data)} bytes were written")


def send(command, first=b"", second=b""):
    message = struct.pack("=i", command) + to_bytes(first) + b"\0" + to_bytes(second) + b"\0"
    raw(message.ljust(SHORTEST_MESSAGE, b"\0"))


def read_input(count):
    data = b""
    while len(data) < count:
        part = os.read(STDIN, count - len(data))
        if not part:
            raise EOFError(f"the input ended after {len(data)} of {count} bytes")
        data += part
    return data


def answer():
    status, length = struct.unpack("=ii", read_input(8))
    text = read_input(length + 1)
    if text[-1:] != b"\0":
        raise ValueError("an answer that does not end in a zero byte")
    return status, text[:-1]


def call(command, first=b"", second=b""):
    send(command, first, second)
    return answer()


def body(count=None):
    return read_input(int(args[7]) if count is None else count)


def output(data):
    with open(args[4], "ab") as file:
        file.write(to_bytes(data))


def say_exit():
    raw(b"EXIT")


def main():
    with open(args[2], "rb") as file:
        code = compile(file.read(), args[2], "exec")
    names = {name: globals()[name] for name in (
        "send", "raw", "answer", "call", "body", "output", "args", "say_exit",
        "os", "signal", "struct", "sys", "time")}
    try:
        exec(code, names)
    except Exception:
        traceback.print_exc()
        return FAILED
    return 0


if __name__ == "__main__":
    sys.exit(main())
