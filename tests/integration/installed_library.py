"""The library as an outside program meets it: installed with `cmake --install` into
a prefix of its own, the C example built against the installed header and pkg-config
file alone and run against the real daemon, and the Python example run with the
installed module.

    installed_library.py BUILD_DIRECTORY SOURCE_DIRECTORY MXREPORTINGD"""

import glob
import os
import shutil
import sqlite3
import subprocess
import sys
import tempfile

from harness import Checks, Daemon, wait_for


def run(arguments, **options):
    return subprocess.run(arguments, capture_output=True, text=True, **options)


def main():
    build, source, binary = sys.argv[1:4]
    checks = Checks()
    prefix = tempfile.mkdtemp(prefix="mxreporting-prefix-")
    daemon = None
    try:
        installed = run(["cmake", "--install", build, "--prefix", prefix])
        checks.equal("installed", installed.returncode, 0)
        pc = glob.glob(os.path.join(prefix, "**", "pkgconfig", "mxreporting.pc"), recursive=True)
        checks.equal("one pkg-config file", len(pc), 1)
        library = glob.glob(os.path.join(prefix, "**", "libmxreporting.so.0"), recursive=True)
        exported = run(["nm", "-D", "--defined-only", library[0]]).stdout.split("\n")
        names = [line.split()[-1] for line in exported if line.strip()]
        strays = [name for name in names if not name.startswith("mxr_") and name != "MXREPORTING_0"]
        checks.equal("only mxr_ symbols exported", strays, [])

        flags = run(["pkg-config", "--cflags", "--libs", "mxreporting"],
                    env=dict(os.environ, PKG_CONFIG_PATH=os.path.dirname(pc[0]))).stdout.split()
        program = os.path.join(prefix, "realtime_reporter")
        # A sanitized build's library needs its runtime linked into the program.
        sanitizer = os.environ.get("MXREPORTING_EXAMPLE_LINK_FLAGS", "").split()
        compiled = run(["cc", "-std=c99", "-Wall", "-Werror", os.path.join(source, "examples/realtime_reporter.c"),
                        *flags, *sanitizer, "-lpthread", "-o", program])
        checks.equal("the C example builds against the installed files", compiled.returncode, 0)
        print(compiled.stderr, end="")

        daemon = Daemon(binary)
        daemon.connect().sock.close()
        environment = dict(os.environ, MXREPORTING_ROOT=daemon.root)
        tool = run([os.path.join(prefix, "bin", "mxreport"), "status"], env=environment)
        checks.equal("the installed mxreport finds the installed library", tool.returncode, 0)
        print(tool.stderr, end="")
        reported = run([program, "100"], env=environment)
        checks.equal("the C example runs", reported.returncode, 0)
        checks.check("every period reported", "100 reports taken, 0 dropped" in reported.stdout, reported.stdout)

        modules = glob.glob(os.path.join(prefix, "**", "mxreporting", "__init__.py"), recursive=True)
        checks.equal("one Python module", len(modules), 1)
        environment["PYTHONPATH"] = os.path.dirname(os.path.dirname(modules[0]))
        script = run(["/usr/bin/python3", os.path.join(source, "examples/report.py")], env=environment)
        checks.equal("the Python example runs", script.returncode, 0)

        def stored(name):
            with sqlite3.connect(daemon.path("var/lib/harmonia/tally.db")) as store:
                return store.execute("SELECT count(*) FROM events WHERE name = ?", (name,)).fetchone()[0]
        checks.check("what both sent is stored", wait_for(
            lambda: stored("com.kestrel.harmonia.Session_Playback.Generic") == 101), daemon.log()[-2000:])
    finally:
        if daemon:
            daemon.close(checks.failed > 0)
        shutil.rmtree(prefix, ignore_errors=True)
    return checks.summary()


if __name__ == "__main__":
    sys.exit(main())
