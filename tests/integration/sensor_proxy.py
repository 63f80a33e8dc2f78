#!/usr/bin/python3
"""mxreportingd with a sensor proxy on its system bus: a private dbus-daemon, a
stand-in net.hadess.SensorProxy (this script run with --stand-in), and the daemon
pointed at that bus. The accelerometer is claimed while a tracked session is started
and released at its stop; the proxy's orientation changes become the session's
records, and a repeated reading is no change."""

import json
import os
import shutil
import sqlite3
import subprocess
import sys
import tempfile

from harness import BOUND, Checks, Daemon, wait_for

PROXY = "net.hadess.SensorProxy"


def stand_in():
    """The proxy: says "claimed"/"released" on stdout, reads new orientations on stdin."""
    import dbus
    import dbus.service
    from dbus.mainloop.glib import DBusGMainLoop
    from gi.repository import GLib

    DBusGMainLoop(set_as_default=True)
    bus = dbus.bus.BusConnection(os.environ["DBUS_SYSTEM_BUS_ADDRESS"])

    class Proxy(dbus.service.Object):
        orientation = "normal"

        @dbus.service.method(PROXY)
        def ClaimAccelerometer(self):
            print("claimed", flush=True)

        @dbus.service.method(PROXY)
        def ReleaseAccelerometer(self):
            print("released", flush=True)

        @dbus.service.method(dbus.PROPERTIES_IFACE, in_signature="ss", out_signature="v")
        def Get(self, interface, name):
            return dbus.String(self.orientation)

        @dbus.service.signal(dbus.PROPERTIES_IFACE, signature="sa{sv}as")
        def PropertiesChanged(self, interface, changed, invalidated):
            pass

    proxy = Proxy(bus, "/net/hadess/SensorProxy")
    name = dbus.service.BusName(PROXY, bus)

    def read(source, condition):
        line = sys.stdin.readline().strip()
        if not line:
            loop.quit()
            return False
        proxy.orientation = line
        proxy.PropertiesChanged(PROXY, {"AccelerometerOrientation": dbus.String(line, variant_level=1)}, [])
        print("changed " + line, flush=True)
        return True

    loop = GLib.MainLoop()
    GLib.io_add_watch(sys.stdin, GLib.IO_IN | GLib.IO_HUP, read)
    print("ready " + name.get_name(), flush=True)
    loop.run()


def main():
    scratch = tempfile.mkdtemp(prefix="mxreporting-bus-")
    address = "unix:path=" + os.path.join(scratch, "system_bus_socket")
    bus = subprocess.Popen(["dbus-daemon", "--session", "--nofork", "--address=" + address],
                           stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
    env = dict(os.environ, DBUS_SYSTEM_BUS_ADDRESS=address)
    wait_for(lambda: os.path.exists(address[len("unix:path="):]))
    proxy = subprocess.Popen([sys.executable, __file__, "--stand-in"], env=env, text=True,
                             stdin=subprocess.PIPE, stdout=subprocess.PIPE)
    checks = Checks()
    daemon = None
    try:
        checks.equal("stand-in up", proxy.stdout.readline().strip(), "ready " + PROXY)
        daemon = Daemon(sys.argv[1], files={"etc/harmonia/device.json": '{"InternalBuild": true}'},
                        env={"DBUS_SYSTEM_BUS_ADDRESS": address, "reporting_session_verbose": "5"})
        client = daemon.connect()
        client.call("createReportingSession:reply:", 7)
        client.call("setServiceType:reportingSession:reply:", 7, 7)
        started = client.send("startReportingSessionForID:reply:", 7)
        client.call("sendMessage:withCategory:andType:forReportingIDs:reply:", {"rate": 48000}, 3, 1, [7])
        checks.equal("claimed at the start", proxy.stdout.readline().strip(), "claimed")
        checks.check("first reading taken", wait_for(lambda: "from the sensor proxy" in daemon.log()), daemon.log())

        for text in ["left-up", "left-up", "bottom-up"]:
            proxy.stdin.write(text + "\n")
            proxy.stdin.flush()
            checks.equal("proxy changed", proxy.stdout.readline().strip(), "changed " + text)
        checks.check("changes recorded", wait_for(lambda: 'orientation="portrait-upside-down"' in daemon.log()),
                     daemon.log())

        client.call("stopReportingSessionForID:reply:", 7)
        checks.equal("start answered at the stop", client.reply(started), (None, True))
        checks.equal("released at the stop", proxy.stdout.readline().strip(), "released")

        def summary():
            with sqlite3.connect(daemon.path("var/lib/harmonia/uplink.db")) as store:
                rows = store.execute("SELECT payload FROM messages WHERE category = 65535").fetchall()
            return json.loads(rows[0][0]) if rows else None

        checks.check("summary stored", wait_for(lambda: summary() is not None))
        checks.equal("records: each change once, the first reading none",
                     (summary() or {}).get("device_orientation"), "landscape-left,portrait-upside-down")
    finally:
        proxy.stdin.close()
        proxy.wait(BOUND)
        bus.terminate()
        bus.wait(BOUND)
        shutil.rmtree(scratch, ignore_errors=True)
        if daemon:
            daemon.close(checks.failed > 0)
    return checks.summary()


if __name__ == "__main__":
    sys.exit(stand_in() if sys.argv[1:] == ["--stand-in"] else main())
