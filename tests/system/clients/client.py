#!/usr/bin/python3
"""As client.c, by the Python package."""
import sys

import vxreporting

identifier = int(sys.argv[1])
with vxreporting.Client(keep_sessions=True) as client:
    with client.session(identifier, service_type="telephony") as session:
        for line in sys.stdin:
            try:
                session.send({"gain": 0.5}, category=5, type=2)
                print("accepted", flush=True)
            except vxreporting.Error as error:
                print(error, flush=True)
