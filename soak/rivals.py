"""keepalived and corosync on a node, and what they report about the peer."""

import os
import re

VRRP = """global_defs {{ router_id {name}
vrrp_notify_fifo /run/keepalived.fifo
vrrp_version {version}
}}
{instances}"""
INSTANCE = """vrrp_instance {name} {{
 state BACKUP
 interface eth1
 virtual_router_id {id}
 priority {priority}
 advert_int {interval}
 virtual_ipaddress {{ 10.77.1.{id}/32 dev eth1 }}
}}
"""
TOTEM = """totem {{
 version: 2
 cluster_name: pressure
 transport: udpu
 crypto_cipher: none
 crypto_hash: none
{token}}}
nodelist {{
 node {{
  ring0_addr: 10.77.0.1
  name: a
  nodeid: 1
 }}
 node {{
  ring0_addr: 10.77.0.2
  name: b
  nodeid: 2
 }}
}}
quorum {{
 provider: corosync_votequorum
 two_node: 1
}}
logging {{
 to_stderr: no
 to_syslog: no
 to_logfile: yes
 logfile: /var/log/corosync/corosync.log
 timestamp: hires
}}
"""


class Keepalived:
    """VRRP with an advertisement every `interval` seconds; as master it considers the peer dead."""

    def __init__(self, node, interval, priority):
        self.node, self.interval, self.priority = node, interval, priority
        self.fifo = None
        self.states = ""

    def start(self):
        number, version = (1, 2) if self.interval >= 1 else (2, 3)
        instance = INSTANCE.format(name="V", id=number, priority=self.priority, interval=self.interval)
        configuration = VRRP.format(name=self.node.name, version=version, instances=instance)
        self.node.path("/run/keepalived.conf").write_text(configuration)
        fifo = self.node.path("/run/keepalived.fifo")
        if not fifo.exists():
            os.mkfifo(fifo)
        if self.fifo is None:
            self.fifo = os.open(fifo, os.O_RDWR | os.O_NONBLOCK)
        for name in ("keepalived.pid", "vrrp.pid"):  # of a killed process that may still exist
            self.node.path(f"/run/{name}").unlink(missing_ok=True)
        self.node.start("keepalived", "keepalived", "--dont-fork", "--vrrp", "-f", "/run/keepalived.conf", "-p",
                        "/run/keepalived.pid", "-r", "/run/vrrp.pid")

    def _read(self):
        try:
            self.states += os.read(self.fifo, 65536).decode()
        except BlockingIOError:
            pass

    def sees_peer(self):
        self._read()
        states = re.findall(r'"V" (MASTER|BACKUP|FAULT)', self.states)
        return bool(states) and states[-1] == "BACKUP"

    def times_dead(self):
        self._read()
        return len(re.findall(r'"V" MASTER', self.states))

    def end(self):
        if "keepalived" in self.node.processes:
            self.node.signal(15, ["keepalived"])
            self.node.processes["keepalived"].wait()
            self.node.kill(["keepalived"])
        if self.fifo is not None:
            os.close(self.fifo)
            self.fifo = None


class Corosync:
    """Totem with a token timeout of `token` milliseconds (0: its default)."""

    def __init__(self, node, token=0):
        self.node, self.token = node, token

    def start(self):
        token = f" token: {self.token}\n" if self.token else ""
        self.node.path("/run/corosync.conf").write_text(TOTEM.format(token=token))
        self.node.start("corosync", "corosync", "-f", "-c", "/run/corosync.conf")

    def _members(self):
        log = self.node.path("/var/log/corosync/corosync.log")
        text = log.read_text(errors="replace") if log.exists() else ""
        return re.findall(r"\[QUORUM\] Members\[(\d)\]", text)

    def sees_peer(self):
        members = self._members()
        return bool(members) and members[-1] == "2"

    def times_dead(self):
        members = self._members()
        return sum(1 for one, two in zip(members, members[1:]) if one == "2" and two == "1")

    def end(self):
        if "corosync" in self.node.processes:
            self.node.kill(["corosync"])
