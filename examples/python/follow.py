#!/usr/bin/env python3
"""Follows the monitor queues of one name and prints their records, one a line.

    follow.py [--socket PATH] [--since N] NAME

Each line is "TYPE/FILE SEQ KIND PATH MASK"; names and paths are printed
escaped (a byte that is not UTF-8 as \\udcXY, a control character as \\n or
\\xNN), never as raw bytes.  Runs until interrupted; reconnects when the
daemon restarts.
"""

import argparse
import sys

import zorvnotifyd


def shown(text: str) -> str:
    """text as printable ASCII."""
    return text.encode("unicode_escape").decode("ascii")


def main() -> int:
    parser = argparse.ArgumentParser(description="Print the records of the queues named NAME.")
    parser.add_argument("--socket", default=zorvnotifyd.DEFAULT, help="the daemon's socket")
    parser.add_argument("--since", type=int, help="start after this sequence number")
    parser.add_argument("name", help="the queues' name")
    args = parser.parse_args()
    try:
        with zorvnotifyd.Subscription(args.socket) as subscription:
            subscription.subscribe(args.name, since=args.since)
            for event in subscription.events():
                print(f"{event.type}/{shown(event.file)}", event.seq, event.kind,
                      shown(event.path), event.mask, flush=True)
    except zorvnotifyd.Error as e:
        print(f"follow.py: {e}", file=sys.stderr)
        return 1
    except KeyboardInterrupt:
        pass
    return 0


if __name__ == "__main__":
    sys.exit(main())
