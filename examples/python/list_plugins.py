#!/usr/bin/python3
"""A minimal Python application of libbexil: asks bxd for its plug-ins and prints one line for each.
Needs the python3-bexil package (or python/ of the source tree on PYTHONPATH and libbexil.so.0 where the loader
finds it). Exit status 0 when the daemon answered, whatever the answer; 1 when it is not reachable."""

import sys

import bexil


def main():
    print(f"libbexil {bexil.library_version()} (Python)")
    try:
        with bexil.Client(timeout=10) as client:
            forms = list(client.match())
    except bexil.Error as error:
        if error.no_reply:
            print(f"bxd is not reachable: {error.message}")
            return 1
        print(f"match: code {error.code}: {error.message}")
        return 0
    print(f"match: {len(forms)} plug-ins")
    for form in forms:
        print(f"  {form['identifier']} {form['uuid']} {form['path']}")
    return 0


if __name__ == "__main__":
    sys.exit(main())
