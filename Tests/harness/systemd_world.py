"""A systemd of the test's own as process 1 of fresh namespaces, and in it a user's service manager with a message bus.

The agent is installed into a temporary prefix, and what the user's manager and bus know of it are the installed files.
`run_inside` boots it all and runs a program in it; `UserSession` is what that program sees.
"""

from __future__ import annotations

import contextlib
import os
import pathlib
import pwd
import select
import subprocess
import sys
import tempfile

from jeepney import DBusAddress, MatchRule, Properties, new_method_call
from jeepney.io.blocking import open_dbus_connection
from jeepney.wrappers import unwrap_msg

from harness.protocol import UNIT
from harness.world import BUS_CONFIGURATION, BusError, Client, complaint_of_a_sanitizer, wait_until

USER = pwd.getpwnam("nobody")
RUNTIME = pathlib.Path(f"/run/user/{USER.pw_uid}")
SKIPPED = 77
LONGEST_BOOT = 60

BOOT = """set -e
mkdir "$1"
echo $$ >"$1/cgroup.procs"
exec setpriv --pdeathsig KILL unshare --cgroup --mount --pid --ipc --uts --fork --kill-child --mount-proc --propagation private sh -ec '
    mount -t tmpfs tmpfs /run
    mkdir -p "$1"
    chown "$2" "$1"
    chmod 700 "$1"
    umount -R /sys/fs/cgroup
    mount -t cgroup2 cgroup2 /sys/fs/cgroup
    exec env -i PATH="$PATH" container=test SYSTEMD_UNIT_PATH="$3" /lib/systemd/systemd --log-target=null
' boot "$2" "$3" "$4"
"""

SYSTEM_UNITS = {
    "default.target": "[Unit]\nDefaultDependencies=no\nWants=booted.service\n",
    "booted.service": """[Unit]
DefaultDependencies=no
Requires=user@{uid}.service
After=user@{uid}.service
[Service]
Type=oneshot
ExecStart=/bin/sh -c 'echo >{folder}/booted'
""",
    "user@.service": """[Unit]
DefaultDependencies=no
[Service]
User=%i
Type=notify
Delegate=yes
Environment=HOME={folder}/home XDG_RUNTIME_DIR={runtime} XDG_DATA_DIRS={folder}/usr/share
Environment=SYSTEMD_UNIT_PATH={folder}/user:{runtime}/systemd/transient:{folder}/usr/lib/systemd/user
ExecStart=/lib/systemd/systemd --user --log-target=null
""",
}

USER_UNITS = {
    "default.target": "[Unit]\nWants=dbus.socket timers.target\n",
    **dict.fromkeys(("basic.target", "timers.target", "sockets.target"), "[Unit]\n"),
    "shutdown.target": "[Unit]\nDefaultDependencies=no\n",
    "dbus.socket": "[Socket]\nListenStream=%t/bus\n",
    "dbus.service": """[Unit]
Requires=dbus.socket
[Service]
Type=notify
ExecStart=/usr/bin/dbus-daemon --config-file={folder}/bus.conf --nofork --systemd-activation
StandardError=append:{folder}/log/bus.log
""",
}


def lay_out(folder: pathlib.Path):
    folder.chmod(0o755)
    subprocess.run(["cmake", "--install", os.environ["VELTOID_BUILD"], "--prefix", folder / "usr"], check=True,
                   stdout=subprocess.DEVNULL)
    for manager, units in (("system", SYSTEM_UNITS), ("user", USER_UNITS)):
        (folder / manager).mkdir()
        for name, text in units.items():
            (folder / manager / name).write_text(text.format(folder=folder, runtime=RUNTIME, uid=USER.pw_uid))
    (folder / "bus.conf").write_text(BUS_CONFIGURATION.format(
        listen="systemd:", services=folder / "usr/share/dbus-1/services"))
    for name in ("home", "log"):
        (folder / name).mkdir()
        os.chown(folder / name, USER.pw_uid, USER.pw_gid)
    os.mkfifo(folder / "booted")


def new_control_group() -> pathlib.Path:
    root = pathlib.Path("/sys/fs/cgroup")
    if not (root / "cgroup.procs").exists():
        root /= "unified"
    return root / f"veltoid-test-{os.getpid()}"


def why_not() -> str | None:
    """What keeps this place from booting a systemd in namespaces; none when nothing does."""
    if os.geteuid() != 0:
        return "needs root"
    group = new_control_group()
    try:
        group.mkdir()
        group.rmdir()
    except OSError as error:
        return f"no control group can be made: {error}"
    tried = subprocess.run(["unshare", "--cgroup", "--mount", "--pid", "--ipc", "--uts", "--fork", "--mount-proc", "sh",
                            "-ec", "mount -t tmpfs tmpfs /run; umount -R /sys/fs/cgroup; "
                            "mount -t cgroup2 cgroup2 /sys/fs/cgroup"], capture_output=True, text=True, check=False)
    return tried.stderr.strip().replace("\n", " ") if tried.returncode != 0 else None


def remove_control_group(group: pathlib.Path):
    def removed():
        for directory, _, _ in os.walk(group, topdown=False):
            with contextlib.suppress(OSError):
                os.rmdir(directory)
        return not group.exists()
    wait_until(removed, 20, f"{group} is still in use")


@contextlib.contextmanager
def booted(folder: pathlib.Path):
    """The process id of a systemd that has brought up the user's session."""
    group = new_control_group()
    process = subprocess.Popen(
        ["sh", "-c", BOOT, "boot", group, RUNTIME, f"{USER.pw_uid}:{USER.pw_gid}", folder / "system"],
        stdin=subprocess.DEVNULL)
    try:
        fifo = os.open(folder / "booted", os.O_RDONLY | os.O_NONBLOCK)
        assert select.select([fifo], [], [], LONGEST_BOOT)[0], "systemd did not boot"
        os.close(fifo)
        yield pathlib.Path(f"/proc/{process.pid}/task/{process.pid}/children").read_text().strip()
    finally:
        process.kill()
        process.wait()
        remove_control_group(group)


def run_inside(program: list[str]) -> int:
    """Runs the program in a booted system of its own and returns its exit status."""
    if reason := why_not():
        print(f"skipped: systemd cannot be booted in namespaces here: {reason}")
        return SKIPPED
    with tempfile.TemporaryDirectory(prefix="veltoid-") as name:
        folder = pathlib.Path(name)
        lay_out(folder)
        with booted(folder) as init:
            status = subprocess.run(["nsenter", "--target", init, "--mount", "--pid", "--cgroup", *program],
                                    env={**os.environ, "VELTOID_INSIDE": name}, check=False).returncode
        for log in (folder / "log").iterdir():
            if complaint := complaint_of_a_sanitizer(log.read_text(errors="replace")):
                print(complaint, file=sys.stderr)
                return 1
        return status


class UserSession(contextlib.AbstractContextManager):
    """The bus and the service manager of the user, as seen by a program inside. The agent's settings are its own."""

    def __init__(self, **agent_environment: str):
        self.folder = pathlib.Path(os.environ["VELTOID_INSIDE"])
        self.address = f"unix:path={RUNTIME}/bus"
        self.connection = open_dbus_connection(bus=self.address)
        self.manager = DBusAddress("/org/freedesktop/systemd1", bus_name="org.freedesktop.systemd1",
                                   interface="org.freedesktop.systemd1.Manager")
        wait_until(self.manager_answers, 20, "the service manager is not on the bus")
        self.configure_agent(agent_environment)

    def __exit__(self, *_):
        self.call("StopUnit", "ss", (UNIT, "replace"))
        self.wait_for_state("inactive")
        self.connection.close()

    def manager_answers(self) -> bool:
        with contextlib.suppress(BusError):
            return self.call("Subscribe") == ()
        return False

    def configure_agent(self, environment: dict[str, str]):
        drop_in = self.folder / "user" / f"{UNIT}.d"
        drop_in.mkdir(exist_ok=True)
        lines = ["[Service]", f"StandardError=append:{self.folder}/log/agent.log",
                 *(f"Environment={name}={value}" for name, value in environment.items())]
        if os.environ.get("VELTOID_SANITIZER"):
            # Sanitizers lay out memory themselves; the filter of system calls keeps the one for leaks from its work.
            lines += ["LockPersonality=no", "MemoryDenyWriteExecute=no", "Environment=ASAN_OPTIONS=detect_leaks=0"]
        (drop_in / "test.conf").write_text("\n".join(lines) + "\n")
        self.call("Reload")

    def call(self, method: str, signature: str | None = None, body: tuple = ()):
        message = new_method_call(self.manager, method, signature, body)
        return unwrap_msg(self.connection.send_and_get_reply(message, timeout=30))

    def unit_property(self, name: str, unit: str = UNIT, interface: str = "Unit"):
        address = DBusAddress(self.call("LoadUnit", "s", (unit,))[0], bus_name="org.freedesktop.systemd1",
                              interface=f"org.freedesktop.systemd1.{interface}")
        return unwrap_msg(self.connection.send_and_get_reply(Properties(address).get(name), timeout=30))[0][1]

    def wait_for_state(self, state: str):
        """Blocks until the agent's unit is in that state."""
        path = self.call("LoadUnit", "s", (UNIT,))[0]
        rule = MatchRule(type="signal", interface="org.freedesktop.DBus.Properties", member="PropertiesChanged",
                         path=path)
        self.connection.bus_proxy.AddMatch(rule)
        with self.connection.filter(rule, bufsize=1000) as changes:
            while self.unit_property("ActiveState") != state:
                self.connection.recv_until_filtered(changes, timeout=30)

    def client(self) -> Client:
        return Client(self.address)
