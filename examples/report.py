#!/usr/bin/python3
"""A tool reporting to mxreportingd: one long-form audio session with a few reports,
then one report alone. Run with the daemon up; MXREPORTING_ROOT picks a private one."""

import sys

import mxreporting


def main():
    try:
        with mxreporting.Client() as client:
            with client.session(4242, service_type="longformaudio",
                                configuration={"HostApplicationDisplayID": "example.tool"}) as session:
                session.send({"sample rate": 48000, "route": "Speaker"}, category="Session_Playback", type="Start")
                session.send({"underruns": 2, "peak level": -3.5}, category="Session_Playback", type="Generic")
                session.send({"sample rate": 48000}, category="Session_Playback", type="Stop")
            client.send({"tool": "report.py"}, category=3, type=2)
            print(f"report.py: sent; the daemon now has {len(client.reporters())} sessions")
    except mxreporting.ReportingDisabled:
        print("report.py: reporting is switched off on this host", file=sys.stderr)
        return 1
    except mxreporting.NotConnected as error:
        print(f"report.py: {error}", file=sys.stderr)
        return 2
    return 0


if __name__ == "__main__":
    sys.exit(main())
