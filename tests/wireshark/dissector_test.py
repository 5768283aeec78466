#!/usr/bin/env python3
"""Runs tools/wireshark/vardel.lua in tshark and checks what it decodes.

  dissector_test.py capture LUA SERVER_PEER CLIENT_PEER WORKDIR
      captures a server and a client host exchanging known traffic on a
      random data port, then compares the decoded capture with what was sent.
  dissector_test.py malformed LUA WORKDIR
      writes a capture of hand-built streams on the default ports (valid,
      split, packed and malformed messages) and checks fields and warnings.

Exit code 77 (skipped) when tshark is not installed.
"""
import os
import queue
import random
import re
import shutil
import signal
import socket
import struct
import subprocess
import sys
import tempfile
import threading
import time

SKIP = 77
failures = []


def check(ok, what):
    if not ok:
        failures.append(what)
    return ok


# Every expert item of the dissector, and a Lua error in it.
OURS = ("vardel.bad_length || vardel.too_long || vardel.broken || vardel.control.short || vardel.control.unknown"
        " || vardel.control.extra || _ws.lua.error")


def tshark(lua, pcap, home, fields, prefs=(), extra=()):
    """One row per frame: {field: [values in tree order]}."""
    cmd = ["tshark", "-n", "-r", pcap] + list(extra) + [
        "-X", "lua_script:" + lua, "-o", "tcp.desegment_tcp_streams:TRUE",
        "-T", "fields", "-E", "separator=\t", "-E", "occurrence=a", "-E", "aggregator=|"]
    for p in prefs:
        cmd += ["-o", p]
    for name in fields:
        cmd += ["-e", name]
    # A private home: no personal preferences or plugins (a second copy of the
    # dissector) take part.
    env = dict(os.environ, HOME=home, XDG_CONFIG_HOME=home)
    run = subprocess.run(cmd, capture_output=True, text=True, timeout=120, env=env)
    errors = [line for line in run.stderr.splitlines() if line.strip() and "Running as user" not in line]
    check(run.returncode == 0 and not errors, f"tshark exit {run.returncode}: {errors[:5]}")
    rows = []
    for line in run.stdout.splitlines():
        values = line.split("\t")
        rows.append({name: (v.split("|") if v else []) for name, v in zip(fields, values)})
    return rows


class Peer:
    """A child process whose output lines are collected by a thread."""

    def __init__(self, args):
        self.proc = subprocess.Popen(args, stdin=subprocess.PIPE, stdout=subprocess.PIPE, text=True)
        self.lines = queue.Queue()
        self.seen = []
        threading.Thread(target=self._read, args=(self.proc.stdout,), daemon=True).start()

    def _read(self, stream):
        for line in stream:
            self.lines.put(line.rstrip("\n"))
        self.lines.put(None)

    def wait_for(self, text, timeout=30.0, count=1):
        """Waits until `count` lines (since the start) contain `text`."""
        deadline = time.monotonic() + timeout
        while sum(text in line for line in self.seen) < count:
            try:
                line = self.lines.get(timeout=max(0.0, deadline - time.monotonic()))
            except queue.Empty:
                line = None
            if line is None:
                raise RuntimeError(f"no '{text}' (x{count}) from {self.proc.args[0]}; got {self.seen[-10:]}")
            self.seen.append(line)

    def send(self, line):
        self.proc.stdin.write(line + "\n")
        self.proc.stdin.flush()

    def stop(self, sig=None):
        stop(self.proc, sig)


def stop(proc, sig=None):
    if proc.poll() is None and sig is not None:
        proc.send_signal(sig)
    try:
        proc.wait(timeout=20)
    except subprocess.TimeoutExpired:
        proc.kill()
        proc.wait()


def free_port(server, client):
    """A data port P with TCP P and UDP P + 1 (and P + 2, for the capture's
    marks) free on both test addresses."""
    with socket.socket() as s:
        if s.connect_ex((server, 6000)) == 0:
            raise RuntimeError("another process listens on the control port 6000")
    for _ in range(200):
        port = random.randint(20000, 49999)
        try:
            for address, kind, p in ((server, socket.SOCK_STREAM, port), (server, socket.SOCK_DGRAM, port + 1),
                                     (client, socket.SOCK_DGRAM, port + 1), (server, socket.SOCK_DGRAM, port + 2),
                                     (client, socket.SOCK_DGRAM, port + 2)):
                with socket.socket(socket.AF_INET, kind) as s:
                    s.bind((address, p))
            return port
        except OSError:
            continue
    raise RuntimeError("no free port")


def messages(rows, channel, source):
    """The messages of one channel from `source`, in order: dicts of their fields."""
    out = []
    for row in rows:
        if source not in row["ip.src"]:
            continue
        channels, lengths = row["vardel.channel"], row["vardel.length"]
        types, bandwidths, times = list(row["vardel.control.type"]), list(row["vardel.control.bandwidth"]), \
            list(row["vardel.control.world_time"])
        payloads = list(row.get("vardel.payload", []))
        take = lambda values, kind=float: kind(values.pop(0)) if values else None  # noqa: E731
        for c, length in zip(channels, lengths):
            m = {"frame": int(row["frame.number"][0]), "length": int(length),
                 "segments": int(row["tcp.segment.count"][0]) if row.get("tcp.segment.count") else 1}
            if c == "control":
                m["type"] = take(types, int)
                if m["type"] in (1, 2):
                    m["value"] = take(bandwidths, int)
                elif m["type"] == 8:
                    m["value"] = take(times)
            elif int(length) > 0:
                m["payload"] = take(payloads, lambda v: bytes.fromhex(v.replace(":", "")))
            if c == channel:
                out.append(m)
    return out


def exchange(server_peer, client_peer, server_ip, client_ip, port, peers):
    """The traffic: the opening, small reliable and unreliable messages, a
    burst from the server in one segment, a 200000-byte message, grants."""
    # A long heartbeat latency: a stall of a loaded machine must not drop the client.
    hb = ["--hb-latency", "60"]
    server = Peer([server_peer, "--host", server_ip, "--port", str(port)] + hb)
    peers.append(server)
    server.wait_for("ready")
    client = Peer([client_peer, "--host", client_ip, "--server", server_ip, "--port", str(port)] + hb)
    peers.append(client)
    client.wait_for("connected")
    client.wait_for("bandwidth 10240")
    client.send("send-r 5 rel")
    server.wait_for("recv 5 rel", count=5)
    client.send("send-u 5 unrel")
    server.wait_for("recv 7 unrel", count=5)
    server.send("maximum 1000000")  # room in the client's queue for 200000 bytes
    client.wait_for("bandwidth 1000000")
    server.send("burst 4 srv")
    client.wait_for("recv 5 srv", count=4)
    client.send("qrn 0 1 200000 B")
    client.send("fr")
    server.wait_for("recv 200000 BBBB")
    # Above the server's maximum: the grant that comes back differs from the request.
    client.send("bandwidth 2000000")
    client.wait_for("bandwidth 1000000", count=2)
    for p in (client, server):
        p.send("quit")
        p.wait_for("bye")
        p.stop()


def mark(pcap, source, destination, text):
    """Sends datagrams carrying `text` until the capture file holds one: the
    capture is running, and what it saw before is in the file."""
    deadline = time.monotonic() + 30
    with socket.socket(socket.AF_INET, socket.SOCK_DGRAM) as s:
        s.bind(source)
        while not (os.path.exists(pcap) and text in open(pcap, "rb").read()):
            if time.monotonic() > deadline:
                raise RuntimeError(f"the capture never showed {text}")
            s.sendto(text, destination)
            time.sleep(0.1)


def capture(lua, server_peer, client_peer, workdir):
    if not shutil.which("tshark"):
        return SKIP
    server_ip, client_ip = "127.0.86.1", "127.0.86.2"
    tmp = tempfile.mkdtemp(dir=workdir, prefix="capture-")
    pcap = os.path.join(tmp, "traffic.pcapng")
    port = free_port(server_ip, client_ip)
    flt = f"host {client_ip} and (tcp port 6000 or tcp port {port} or udp portrange {port + 1}-{port + 2})"
    log = open(os.path.join(tmp, "dumpcap.log"), "w")
    dump = subprocess.Popen(["dumpcap", "-i", "lo", "-f", flt, "-w", pcap], stdin=subprocess.DEVNULL,
                            stdout=log, stderr=log)
    peers = []
    try:
        mark(pcap, (client_ip, port + 2), (server_ip, port + 2), b"vardel-capture-start")
        try:
            exchange(server_peer, client_peer, server_ip, client_ip, port, peers)
        except RuntimeError as error:
            # Another server on the machine may have taken the control port meanwhile.
            owner = subprocess.run(["ss", "-ltnp", "sport = :6000"], capture_output=True, text=True).stdout
            raise RuntimeError(f"{error}\nport 6000: {owner}") from None
        mark(pcap, (client_ip, port + 2), (server_ip, port + 2), b"vardel-capture-end")
    except RuntimeError:
        log.flush()
        print(open(log.name).read())
        raise
    finally:
        for p in reversed(peers):
            p.stop(signal.SIGINT)
        stop(dump, signal.SIGINT)
        log.close()
    check(dump.returncode == 0, f"dumpcap exit {dump.returncode}")

    fields = ["frame.number", "ip.src", "vardel.channel", "vardel.length", "vardel.control.type",
              "vardel.control.bandwidth", "vardel.control.world_time", "vardel.payload", "tcp.segment.count",
              "_ws.expert.message", "_ws.col.Info"]
    rows = tshark(lua, pcap, tmp, fields, [f"vardel.data_port:{port}"])
    check(len(rows) > 20, f"only {len(rows)} frames captured")
    flagged = tshark(lua, pcap, tmp, ["frame.number", "_ws.expert.message"], [f"vardel.data_port:{port}"],
                     ["-Y", OURS])
    check(not flagged, f"warnings on valid traffic: {flagged[:5]}")

    # Reliable data: five small messages, then one of 200000 bytes reassembled from several segments.
    sent = messages(rows, "reliable", client_ip)
    check([m["length"] for m in sent] == [5] * 5 + [200000], f"client reliable lengths {[m['length'] for m in sent]}")
    check([m.get("payload") for m in sent[:5]] == [b"rel%d;" % i for i in range(5)], "client reliable payloads")
    check(len(sent) == 6 and sent[5]["payload"] == b"B" * 200000 and sent[5]["segments"] >= 2,
          f"200000-byte message not reassembled: {[(m['length'], m['segments']) for m in sent[5:]]}")
    # The server's burst: four messages, all in one segment.
    got = messages(rows, "reliable", server_ip)
    check([m.get("payload") for m in got] == [b"srv%d;" % i for i in range(4)], f"server reliable {got}")
    check(len({m["frame"] for m in got}) == 1, f"burst spread over frames {[m['frame'] for m in got]}")
    # Unreliable data: one datagram per message, client to server only.
    udp = messages(rows, "unreliable", client_ip)
    check([(m["length"], m.get("payload")) for m in udp] == [(7, b"unrel%d;" % i) for i in range(5)],
          f"datagrams {[(m['length'], m.get('payload')) for m in udp]}")
    check(len({m["frame"] for m in udp}) == 5, "one frame per datagram")
    check(not messages(rows, "unreliable", server_ip), "datagrams from the server")

    # Control: the opening in exact order, then requests and grants.
    up, down = messages(rows, "control", client_ip), messages(rows, "control", server_ip)
    for name, ms in (("client", up), ("server", down)):
        check(all(m["length"] == (8 if m["type"] in (1, 2, 8) else 4) for m in ms), f"{name} control lengths")
    names = {1: "BANDWIDTH_REQUEST", 2: "BANDWIDTH_GRANT", 3: "HEARTBEAT", 4: "HEARTBEAT_REPLY", 7: "WORLD_TIME_REQUEST",
             8: "WORLD_TIME"}
    for row in rows:
        types = [names.get(int(t)) for t in row["vardel.control.type"]]
        shown = re.findall(r"CONTROL_(\w+)", row["_ws.col.Info"][0] if row["_ws.col.Info"] else "")
        check(shown == types, f"frame {row['frame.number'][0]}: info {row['_ws.col.Info']}, types {types}")
    check([m["type"] for m in up[:5]] == [1, 7, 3, 7, 7], f"client opening {[m['type'] for m in up[:8]]}")
    check([m["type"] for m in down[:5]] == [2, 8, 4, 8, 8], f"server opening {[m['type'] for m in down[:8]]}")
    check([m["type"] for m in up if m["type"] not in (3, 4)] == [1, 7, 7, 7, 1], "client control types")
    check([m["type"] for m in down if m["type"] not in (3, 4)] == [2, 8, 8, 8, 2, 2], "server control types")
    check([m["value"] for m in up if m["type"] == 1] == [1250000, 2000000], "bandwidth requests")
    check([m["value"] for m in down if m["type"] == 2] == [10240, 1000000, 1000000],
          f"grants {[m['value'] for m in down if m['type'] == 2]}")
    times = [m["value"] for m in down if m["type"] == 8]
    check(len(times) == 3 and None not in times and 0 < times[0] <= times[1] <= times[2] < 600, f"world times {times}")
    # Every heartbeat is answered, but the last may still be on its way.
    for name, beats, replies in (("client", up, down), ("server", down, up)):
        b, r = sum(m["type"] == 3 for m in beats), sum(m["type"] == 4 for m in replies)
        check(r in (b, b - 1) and (name == "server" or r >= 1), f"{name} heartbeats {b}, replies {r}")
    if not failures:
        shutil.rmtree(tmp)
    return 0


# --- hand-made streams --------------------------------------------------------

def checksum(data):
    data += b"\0" * (len(data) % 2)
    s = sum(struct.unpack(f"!{len(data) // 2}H", data))
    s = (s >> 16) + (s & 0xFFFF)
    return ~(s + (s >> 16)) & 0xFFFF


class Pcap:
    """A classic pcap of Ethernet/IPv4 frames with running TCP sequence numbers."""

    def __init__(self):
        self.frames, self.seq = [], {}

    def add(self, src, dst, payload, udp=False):
        (sip, sport), (dip, dport) = src, dst
        if udp:
            l4, proto = struct.pack("!HHHH", sport, dport, 8 + len(payload), 0), 17
        else:
            seq = self.seq.setdefault((src, dst), 1000)
            ack = self.seq.setdefault((dst, src), 1000)
            self.seq[(src, dst)] = seq + len(payload)
            l4, proto = struct.pack("!HHIIBBHHH", sport, dport, seq, ack, 5 << 4, 0x18, 65535, 0, 0), 6
        ip = struct.pack("!BBHHHBBH4s4s", 0x45, 0, 20 + len(l4) + len(payload), len(self.frames), 0x4000, 64,
                         proto, 0, socket.inet_aton(sip), socket.inet_aton(dip))
        ip = ip[:10] + struct.pack("!H", checksum(ip)) + ip[12:]
        self.frames.append(b"\0\0\0\0\0\1" + b"\0\0\0\0\0\2" + b"\x08\x00" + ip + l4 + payload)
        return len(self.frames)

    def write(self, path):
        with open(path, "wb") as f:
            f.write(struct.pack("<IHHiIII", 0xA1B2C3D4, 2, 4, 0, 0, 262144, 1))
            for i, frame in enumerate(self.frames):
                f.write(struct.pack("<IIII", 1700000000, i * 1000, len(frame), len(frame)) + frame)


def framed(payload):
    return struct.pack("<I", len(payload)) + payload


def control(type_, value=None, extra=b""):
    return framed(struct.pack("<I", type_) + (b"" if value is None else value) + extra)


def malformed(lua, workdir):
    if not shutil.which("tshark"):
        return SKIP
    tmp = tempfile.mkdtemp(dir=workdir, prefix="malformed-")
    pcap = os.path.join(tmp, "streams.pcap")
    c, s = ("127.0.0.2", 40000), ("127.0.0.1", 6000)
    d, sd = ("127.0.0.2", 40001), ("127.0.0.1", 3123)
    o, so = ("127.0.0.3", 40002), ("127.0.0.1", 4000)
    p = Pcap()
    world = control(8, struct.pack("<f", 1.5))
    # frame: (types, lengths, expected warning texts); NOTE-level texts are listed too.
    expect = {
        p.add(c, s, control(1, struct.pack("<I", 1250000)) + control(7)): ([1, 7], [8, 4], []),
        p.add(s, c, control(2, struct.pack("<I", 10240)) + world[:6]): ([2], [8], []),
        p.add(s, c, world[6:]): ([8], [8], []),
        p.add(c, s, control(1, b"\1\2")): ([1], [6], ["CONTROL_BANDWIDTH_REQUEST of 6 bytes, needs 8"]),
        p.add(c, s, framed(b"\3\0")): ([], [2], ["no type word"]),
        p.add(c, s, control(9)): ([9], [4], ["Unknown control type 9"]),
        p.add(s, c, control(3, extra=b"\0\0\0\0")): ([3], [8], ["4 bytes past the record"]),
        p.add(c, s, struct.pack("<I", 0x80000004) + b"\3\0\0\0"): ([], [0x80000004], ["0x80000004 is above"]),
        p.add(c, s, control(3)): ([], [], ["the receiver dropped this"]),
        p.add(d, sd, framed(b"") + framed(b"hello") + framed(b"abc")): ([], [0, 5, 3], []),
        p.add(d, sd, framed(b"x" * 3000)[:1000]): ([], [], []),
        p.add(d, sd, framed(b"x" * 3000)[1000:] + framed(b"split")[:2]): ([], [3000], []),
        p.add(d, sd, framed(b"split")[2:]): ([], [5], []),
        p.add(d, sd, struct.pack("<I", 0x7FFFFFFC)): ([], [0x7FFFFFFC], ["0x7FFFFFFC is above"]),
        p.add(("127.0.0.2", 3124), ("127.0.0.1", 3124), b"datagram", udp=True): ([], [8], []),
        p.add(o, so, framed(b"moved")): ([], [], []),
        p.add(("127.0.0.3", 4001), ("127.0.0.1", 4001), b"dg", udp=True): ([], [], []),
    }
    p.write(pcap)
    fields = ["frame.number", "vardel.control.type", "vardel.length", "vardel.control.world_time",
              "_ws.expert.message", "_ws.expert.severity"]
    warn, note = str(0x00600000), str(0x00400000)

    def verify(rows, expected, label):
        check(len(rows) == len(p.frames), f"{label}: {len(rows)} frames")
        for row in rows:
            n = int(row["frame.number"][0])
            types, lengths, texts = expected.get(n, ([], [], []))
            got = (list(map(int, row["vardel.control.type"])), list(map(int, row["vardel.length"])))
            check(got == (types, lengths), f"{label} frame {n}: types/lengths {got}, want {(types, lengths)}")
            experts = list(zip(row["_ws.expert.message"], row["_ws.expert.severity"]))
            for text in texts:
                level = note if "past the record" in text or "dropped this" in text else warn
                check(any(text in m and sev == level for m, sev in experts), f"{label} frame {n}: no '{text}' in {experts}")
            check(len(experts) == len(texts), f"{label} frame {n}: warnings {experts}, want {texts}")

    rows = tshark(lua, pcap, tmp, fields)
    verify(rows, expect, "default ports")
    verify(tshark(lua, pcap, tmp, fields, extra=["-2"]), expect, "two passes")
    # The expert items are filterable by name, one frame for each.
    flagged = [int(r["frame.number"][0]) for r in tshark(lua, pcap, tmp, ["frame.number"], extra=["-Y", OURS])]
    check(flagged == [n for n, (_, _, texts) in expect.items() if texts], f"expert frames {flagged}")
    check(rows[2]["vardel.control.world_time"] == ["1.5"], f"world time {rows[2]['vardel.control.world_time']}")
    # Data port 4000 by preference (datagrams on 4001); 3123 is plain TCP then.
    moved = {n: v for n, v in expect.items() if n <= 9}
    moved[len(p.frames) - 1] = ([], [5], [])
    moved[len(p.frames)] = ([], [2], [])
    verify(tshark(lua, pcap, tmp, fields, ["vardel.data_port:4000"]), moved, "data port 4000")
    # A length above the largest-message preference ends the connection.
    rows = tshark(lua, pcap, tmp, fields, ["vardel.largest:1000"])
    frame = rows[10]
    check(any("above the largest message" in m for m in frame["_ws.expert.message"]), f"limit: {frame}")
    if not failures:
        shutil.rmtree(tmp)
    return 0


def main():
    mode = sys.argv[1] if len(sys.argv) > 1 else ""
    if mode == "capture" and len(sys.argv) == 6:
        rc = capture(*sys.argv[2:])
    elif mode == "malformed" and len(sys.argv) == 4:
        rc = malformed(*sys.argv[2:])
    else:
        print(__doc__)
        return 2
    if rc == SKIP:
        print("tshark is not installed: skipped")
        return SKIP
    for f in failures:
        print("FAIL:", f)
    print("ok" if not failures else f"{len(failures)} failures")
    return 1 if failures else 0


if __name__ == "__main__":
    sys.exit(main())
