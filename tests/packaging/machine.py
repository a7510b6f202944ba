"""A machine to install packages on: this machine's files under a temporary overlay, in namespaces of its own,
with systemd as its first process."""

import contextlib
import json
import os
import pathlib
import re
import subprocess
import tempfile
import textwrap
import unittest

from harness import PATIENCE, eventually

# Runs in the namespaces before systemd starts. /proc/sys and /sys are the real machine's, and therefore
# read-only.
BOOT = r"""
set -e
root=$1/root
mount --make-rprivate /
mount -t tmpfs tmpfs "$1"
mkdir "$1"/upper "$1"/work "$root"
mount -t overlay -o lowerdir=/,upperdir="$1/upper",workdir="$1/work" overlay "$root"
mount -t proc proc "$root/proc"
mount --bind "$root/proc/sys" "$root/proc/sys"
mount -o remount,bind,ro "$root/proc/sys"
mount -t sysfs -o ro sysfs "$root/sys"
mount -t tmpfs tmpfs "$root/sys/fs/cgroup"
mount -t cgroup2 cgroup2 "$root/sys/fs/cgroup"
for directory in dev run; do mount -t tmpfs -o mode=0755 tmpfs "$root/$directory"; done
for device in null:1:3 zero:1:5 full:1:7 random:1:8 urandom:1:9 tty:5:0; do
  IFS=: read -r name major minor <<<"$device"
  mknod -m 0666 "$root/dev/$name" c "$major" "$minor"
done
mkdir "$root"/dev/{shm,pts,mqueue,hugepages}
mount -t devpts -o newinstance,ptmxmode=0666 devpts "$root/dev/pts"
mount -t mqueue mqueue "$root/dev/mqueue"
ln -s pts/ptmx "$root/dev/ptmx"
ln -s /proc/self/fd "$root/dev/fd"
# Only sockets are started; packages may start their own units.
rm -rf "$root"/etc/systemd/system/* "$root"/lib/systemd/system/*.wants "$root/usr/sbin/policy-rc.d"
wants=$root/etc/systemd/system/sockets.target.wants
mkdir "$wants"
for socket in dbus systemd-journald systemd-journald-dev-log; do
  ln -s "/lib/systemd/system/$socket.socket" "$wants"
done
export container=quarvel
# The loopback interface is brought up: SIOCSIFFLAGS, IFF_UP.
/usr/bin/python3 -c 'import fcntl, socket, struct
fcntl.ioctl(socket.socket(), 0x8914, struct.pack("16sh", b"lo", 1))'
# A process in a chroot may make no user namespaces, which sandboxes need.
mkdir "$root/old"
cd "$root"
pivot_root . old
umount -l /old
exec /lib/systemd/systemd --unit=basic.target
"""


class Machine:
    def __init__(self):
        if os.geteuid() != 0 or not pathlib.Path("/lib/systemd/systemd").exists() or not self._cgroup_mount():
            raise unittest.SkipTest("a systemd of one's own needs root, systemd and a cgroup2 file system")
        self._directory = tempfile.TemporaryDirectory(prefix="quarvel-machine-")
        base = pathlib.Path(self._directory.name)
        (base / "root").mkdir()
        self._cgroup = self._make_cgroup()
        self._boot = base / "boot"
        self._boot.write_text(BOOT)
        enter = f'echo $$ > {self._cgroup}/cgroup.procs && exec "$@"'
        with open(base / "log", "wb") as log:
            self._process = subprocess.Popen(
                ["sh", "-c", enter, "sh", "unshare", "--mount", "--pid", "--fork", "--uts", "--ipc", "--net",
                 "--cgroup", "--kill-child=KILL", "bash", self._boot, base / "root"],
                stdin=subprocess.DEVNULL, stdout=log, stderr=log)
        try:
            self._first = eventually(self._first_process, "there is a first process", 0.05)
            eventually(lambda: self.run("systemctl", "is-active", "basic.target").stdout == "active\n",
                       "systemd is up", 0.05)
        except AssertionError as problem:
            log = (base / "log").read_text(errors="replace").strip()
            self.close()
            raise unittest.SkipTest(f"no systemd can be started here: {problem} {log}") from None

    def _first_process(self):
        if self._process.poll() is not None:
            raise AssertionError("it has ended.")
        children = pathlib.Path(f"/proc/{self._process.pid}/task/{self._process.pid}/children").read_text().split()
        return next((int(child) for child in children
                     if pathlib.Path(f"/proc/{child}/comm").read_text() == "systemd\n"), None)

    @staticmethod
    def _cgroup_mount():
        mounts = (line.split() for line in pathlib.Path("/proc/self/mounts").read_text().splitlines())
        return next((pathlib.Path(place) for _, place, kind, *_ in mounts
                     if kind == "cgroup2" and os.access(place, os.W_OK)), None)

    @staticmethod
    def _make_cgroup():
        [own] = re.findall("(?m)^0::/(.*)$", pathlib.Path("/proc/self/cgroup").read_text())
        cgroup = Machine._cgroup_mount() / own / f"quarvel-test-{os.getpid()}"
        cgroup.mkdir()
        return cgroup

    def close(self):
        self._process.kill()
        self._process.wait(PATIENCE)

        def removed():
            with contextlib.suppress(OSError):  # the last processes of the machine are ending
                for directory, _, _ in os.walk(self._cgroup, topdown=False):
                    os.rmdir(directory)
            return not self._cgroup.exists()
        eventually(removed, "the machine's processes have ended", 0.05)
        self._directory.cleanup()

    def run(self, *command, **options):
        """Runs a command on the machine, as root."""
        return subprocess.run(
            ["nsenter", "-t", str(self._first), *"-m -p -u -i -n -C -r -w".split(), *map(str, command)],
            capture_output=True, text=True, timeout=PATIENCE, **options)

    def must(self, *command, **options):
        """Runs a command that must succeed; returns its output."""
        done = self.run(*command, **options)
        if done.returncode != 0:
            raise AssertionError(f"{command}: {done.returncode}\n{done.stdout}{done.stderr}")
        return done.stdout

    def write(self, path, content):
        self.must("sh", "-c", 'mkdir -p "$(dirname "$1")" && cat > "$1"', "sh", path, input=textwrap.dedent(content))

    def property(self, unit, name):
        return self.must("systemctl", "show", unit, "-P", name).strip()

    def journal(self, unit):
        lines = self.must("journalctl", "-u", unit, "-o", "json", "--no-pager").splitlines()
        return [json.loads(line) for line in lines]
