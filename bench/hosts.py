#!/usr/bin/env python3
"""Many hosts on one catalogue: what their GetDbHash costs an etcd cluster.

Starts a 3-member etcd cluster on free loopback ports (data under --work,
removed at the end, also on failure), fills it with karst_bench's catalogue
of --policies policies and as many datastores, and a SQLite file with the
same. Then, for each host count N of --hosts, starts N karst_host processes
(bench/karst_host.cc), each on all three members with a different one first;
a tenth of them (none of fewer than ten) run the watch, the others call
GetDbHash every T seconds (T = N * --period-per-host, at least --min-period),
each at its own phase. Once every host has made its first (cold) call:

  quiet    --quiet-window seconds with no change;
  replace  --replace-window seconds while another process replaces the
           policies every --replace-every seconds.

For each window it reads etcd's own /metrics of all three members before and
after (bytes sent to clients: etcd_network_client_grpc_sent_bytes_total;
CPU: process_cpu_seconds_total) and divides by the GetDbHash calls begun in
the window; the hosts' latency percentiles and CPU per call come from their
logs. A single host on the SQLite file, polling as fast as the single etcd
host, gives the SQLite figure of the same run.

  bash bench/run --hosts [--hosts 1,50,200 ...]   # or directly:
  python3 bench/hosts.py --host-binary build/bench/bench/karst_host --work build/bench/hosts
"""

import argparse
import ctypes
import json
import os
import shutil
import signal
import socket
import subprocess
import sys
import time
import urllib.request

PREFIX = "karst-hosts"


def die_with_parent():
    """In a child before exec: SIGKILL when the driver goes, however it goes."""
    ctypes.CDLL(None, use_errno=True).prctl(1, signal.SIGKILL)  # PR_SET_PDEATHSIG


def free_ports(n):
    socks = [socket.socket() for _ in range(n)]
    for s in socks:
        s.bind(("127.0.0.1", 0))
    ports = [s.getsockname()[1] for s in socks]
    for s in socks:
        s.close()
    return ports


class Cluster:
    """Three etcd members on loopback, stopped by stop()."""

    def __init__(self, work):
        self.work = work
        ports = free_ports(6)
        self.clients = ports[:3]
        peers = ports[3:]
        initial = ",".join(f"m{i}=http://127.0.0.1:{peers[i]}" for i in range(3))
        self.procs = []
        for i in range(3):
            data = os.path.join(work, f"m{i}")
            os.makedirs(data, mode=0o700)
            log = open(os.path.join(work, f"m{i}.log"), "w")
            self.procs.append(subprocess.Popen(
                ["etcd", "--name", f"m{i}", "--data-dir", data,
                 "--listen-client-urls", f"http://127.0.0.1:{self.clients[i]}",
                 "--advertise-client-urls", f"http://127.0.0.1:{self.clients[i]}",
                 "--listen-peer-urls", f"http://127.0.0.1:{peers[i]}",
                 "--initial-advertise-peer-urls", f"http://127.0.0.1:{peers[i]}",
                 "--initial-cluster", initial, "--initial-cluster-state", "new",
                 "--logger", "zap", "--log-outputs", "stderr"],
                stdout=log, stderr=subprocess.STDOUT, preexec_fn=die_with_parent))
        deadline = time.time() + 30
        while not self.healthy():
            if time.time() > deadline or any(p.poll() is not None for p in self.procs):
                raise RuntimeError(f"etcd did not come up; see {work}/m*.log")
            time.sleep(0.2)

    def endpoints(self, first=0):
        order = [self.clients[(first + i) % 3] for i in range(3)]
        return ",".join(f"127.0.0.1:{p}" for p in order)

    def healthy(self):
        r = subprocess.run(["etcdctl", "--endpoints", self.endpoints(), "endpoint", "health"],
                           capture_output=True)
        return r.returncode == 0

    def metrics(self):
        """Bytes sent to clients and CPU seconds, summed over the members."""
        sent = cpu = 0.0
        for port in self.clients:
            text = urllib.request.urlopen(f"http://127.0.0.1:{port}/metrics", timeout=10).read()
            for line in text.decode().splitlines():
                if line.startswith("etcd_network_client_grpc_sent_bytes_total "):
                    sent += float(line.split()[1])
                elif line.startswith("process_cpu_seconds_total "):
                    cpu += float(line.split()[1])
        return {"sent": sent, "cpu": cpu, "time": time.time()}

    def stop(self):
        for p in self.procs:
            if p.poll() is None:
                p.terminate()
        for p in self.procs:
            try:
                p.wait(timeout=10)
            except subprocess.TimeoutExpired:
                p.kill()
                p.wait()


class Hosts:
    """karst_host processes, each logging to a file of its own."""

    def __init__(self, binary, work):
        self.binary = binary
        self.work = work
        self.procs = []  # (process, log, kind)

    def start(self, kind, args, locator, name):
        log = os.path.join(self.work, name)
        env = dict(os.environ, TAVO_CONFIGSTORE_PATH=locator)
        err = open(log + ".err", "w")
        p = subprocess.Popen([self.binary, kind] + args + [log], env=env,
                             stdout=subprocess.DEVNULL, stderr=err, preexec_fn=die_with_parent)
        self.procs.append((p, log, kind))
        return log

    def wait_ready(self, limit):
        deadline = time.time() + limit
        for p, log, _ in self.procs:
            while not os.path.exists(log + ".ready"):
                if p.poll() is not None:
                    raise RuntimeError(f"{log}: host ended: {open(log + '.err').read()}")
                if time.time() > deadline:
                    raise RuntimeError(f"{log}: no first call within {limit} s")
                time.sleep(0.1)

    def stop(self, logs=None):
        chosen = [h for h in self.procs if logs is None or h[1] in logs]
        for _, log, _ in chosen:
            open(log + ".stop", "w").close()
        for p, _, _ in chosen:
            try:
                p.wait(timeout=60)
            except subprocess.TimeoutExpired:
                p.kill()
                p.wait()
        self.procs = [h for h in self.procs if h not in chosen]

    def kill_all(self):
        for p, _, _ in self.procs:
            if p.poll() is None:
                p.kill()
        for p, _, _ in self.procs:
            p.wait()
        self.procs = []


def read_log(path):
    calls, errors, end = [], [], None
    with open(path) as f:
        for line in f:
            parts = line.split()
            if parts[0] in ("call", "cold"):
                calls.append({"cold": parts[0] == "cold", "start": float(parts[1]),
                              "ms": float(parts[2]), "cpu_ms": float(parts[3]),
                              "changed": parts[4] == "1"})
            elif parts[0] == "error":
                errors.append({"start": float(parts[1]), "text": " ".join(parts[5:])})
            elif parts[0] == "end":
                end = {"cpu_ms": float(parts[1]), "rss_kb": int(parts[2])}
    return calls, errors, end


def percentiles(values):
    if not values:
        return {}
    values = sorted(values)

    def at(q):
        return values[min(len(values) - 1, int(q * len(values)))]
    return {"n": len(values), "p50": at(0.5), "p90": at(0.9), "p99": at(0.99),
            "max": values[-1], "mean": sum(values) / len(values)}


def window_figures(logs, before, after, idle_cpu_per_s=0.0):
    """The calls begun between two metrics readings, and what they cost; the
    etcd CPU of an idle cluster over as long ("idle_cpu_per_s") is taken off
    for the net figure."""
    calls, errors = [], []
    for log, kind in logs:
        c, e, _ = read_log(log)
        calls += [dict(x, kind=kind) for x in c
                  if not x["cold"] and before["time"] <= x["start"] < after["time"]]
        errors += [x for x in e if before["time"] <= x["start"] < after["time"]]
    n = len(calls)
    sent = after["sent"] - before["sent"]
    cpu = after["cpu"] - before["cpu"]
    return {
        "seconds": after["time"] - before["time"],
        "calls": n,
        "changed_calls": sum(c["changed"] for c in calls),
        "errors": len(errors),
        "error_sample": errors[0]["text"] if errors else "",
        "etcd_sent_bytes": sent,
        "etcd_cpu_s": cpu,
        "sent_bytes_per_call": sent / n if n else None,
        "etcd_cpu_ms_per_call": 1e3 * cpu / n if n else None,
        "etcd_cpu_ms_per_call_net":
            1e3 * (cpu - idle_cpu_per_s * (after["time"] - before["time"])) / n if n else None,
        "latency_ms": percentiles([c["ms"] for c in calls if not c["changed"]]),
        "latency_changed_ms": percentiles([c["ms"] for c in calls if c["changed"]]),
        "client_cpu_ms": percentiles([c["cpu_ms"] for c in calls if not c["changed"]]),
        "client_cpu_changed_ms": percentiles([c["cpu_ms"] for c in calls if c["changed"]]),
        "watch_latency_ms": percentiles([c["ms"] for c in calls if c["kind"] == "watch"]),
    }


def run_hosts(args, cluster, n, results):
    period = max(args.min_period, n * args.period_per_host)
    watchers = n // 10 if n >= 10 else 0
    work = os.path.join(args.work, f"n{n}")
    os.makedirs(work)
    hosts = Hosts(args.host_binary, work)
    try:
        logs = []
        for i in range(n):
            kind = "watch" if i < watchers else "poll"
            locator = f"etcd://{cluster.endpoints(i % 3)}/{PREFIX}"
            extra = [] if kind == "watch" else [str(period)]
            logs.append((hosts.start(kind, extra, locator, f"host{i}"), kind))
        hosts.wait_ready(600)
        figures = {"hosts": n, "watchers": watchers, "period_s": period}
        time.sleep(min(period, 5))  # the last cold reads' replies are on their way
        m0 = cluster.metrics()
        time.sleep(args.quiet_window)
        m1 = cluster.metrics()
        figures["quiet"] = window_figures(logs, m0, m1, args.idle_cpu_per_s)
        print(f"N={n} quiet: {json.dumps(figures['quiet'])}", flush=True)
        if args.replace_window > 0:
            writer = hosts.start("replace", [str(args.policies), str(args.replace_every)],
                                 f"etcd://{cluster.endpoints()}/{PREFIX}", "writer")
            m2 = cluster.metrics()
            time.sleep(args.replace_window)
            m3 = cluster.metrics()
            hosts.stop([writer])
            replaces, _, _ = read_log(writer)
            figures["replace"] = window_figures(logs, m2, m3, args.idle_cpu_per_s)
            figures["replace"]["replaces"] = len(replaces)
            figures["replace"]["replace_ms"] = [c["ms"] for c in replaces]
            print(f"N={n} replace: {json.dumps(figures['replace'])}", flush=True)
        hosts.stop()
        ends = [read_log(log)[2] for log, _ in logs]
        figures["host_rss_mib"] = percentiles([e["rss_kb"] / 1024 for e in ends if e])
        results.append(figures)
    finally:
        hosts.kill_all()


def run_sqlite(args, results):
    work = os.path.join(args.work, "sqlite")
    os.makedirs(work)
    db = os.path.join(work, "catalogue.db")
    env = dict(os.environ, TAVO_CONFIGSTORE_PATH=db)
    subprocess.run([args.host_binary, "fill", str(args.policies)], env=env, check=True)
    hosts = Hosts(args.host_binary, work)
    try:
        log = hosts.start("poll", [str(args.min_period)], db, "host0")
        hosts.wait_ready(120)
        start = {"time": time.time(), "sent": 0, "cpu": 0}
        time.sleep(args.quiet_window)
        end = {"time": time.time(), "sent": 0, "cpu": 0}
        hosts.stop()
        figures = window_figures([(log, "poll")], start, end)
        results.append({"sqlite": True, "quiet": figures})
        print(f"SQLite: {json.dumps(figures)}", flush=True)
    finally:
        hosts.kill_all()


def main():
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument("--host-binary", required=True)
    parser.add_argument("--work", required=True, help="a folder of its own; emptied first")
    parser.add_argument("--hosts", default="1,50,200")
    parser.add_argument("--policies", type=int, default=10000)
    parser.add_argument("--period-per-host", type=float, default=0.1)
    parser.add_argument("--min-period", type=float, default=0.5)
    parser.add_argument("--quiet-window", type=float, default=60)
    parser.add_argument("--replace-window", type=float, default=150)
    parser.add_argument("--replace-every", type=float, default=60)
    parser.add_argument("--idle-window", type=float, default=20)
    parser.add_argument("--out", help="the figures as JSON")
    args = parser.parse_args()
    args.host_binary = os.path.abspath(args.host_binary)
    args.work = os.path.abspath(args.work)

    # A signal ends the run through the cleanup below.
    def interrupted(signum, frame):
        raise KeyboardInterrupt
    signal.signal(signal.SIGTERM, interrupted)

    shutil.rmtree(args.work, ignore_errors=True)
    os.makedirs(args.work, mode=0o700)
    results = []
    cluster = None
    try:
        run_sqlite(args, results)
        cluster = Cluster(os.path.join(args.work, "etcd"))
        subprocess.run([args.host_binary, "fill", str(args.policies)], check=True,
                       env=dict(os.environ,
                                TAVO_CONFIGSTORE_PATH=f"etcd://{cluster.endpoints()}/{PREFIX}"))
        # What the cluster spends with no client at all (heartbeats and
        # the like), taken off each window's CPU for the net figure.
        time.sleep(5)
        before = cluster.metrics()
        time.sleep(args.idle_window)
        after = cluster.metrics()
        args.idle_cpu_per_s = (after["cpu"] - before["cpu"]) / (after["time"] - before["time"])
        results.append({"idle": True, "cpu_per_s": args.idle_cpu_per_s,
                        "sent_per_s": (after["sent"] - before["sent"]) /
                        (after["time"] - before["time"])})
        print(f"idle cluster: {results[-1]}", flush=True)
        for n in [int(x) for x in args.hosts.split(",")]:
            run_hosts(args, cluster, n, results)
    finally:
        if cluster:
            cluster.stop()
        shutil.rmtree(args.work, ignore_errors=True)
    if args.out:
        with open(args.out, "w") as f:
            json.dump({"policies": args.policies, "results": results}, f, indent=1)
    report(args, results)


def report(args, results):
    def f(x, digits=2):
        return "-" if x is None else f"{x:,.{digits}f}"
    print()
    print(f"{args.policies:,} policies and datastores; etcd figures summed over 3 members")
    print("| hosts (watching) | T s | window | calls | changed | errors | etcd bytes sent / call "
          "| etcd CPU ms / call (net) | latency ms p50 / p90 / p99 (unchanged) "
          "| latency ms p50 / p99 (changed) | client CPU ms / call (unchanged) |")
    print("|---|---|---|---|---|---|---|---|---|---|---|")
    for r in results:
        if r.get("idle"):
            print(f"idle cluster: {1e3 * r['cpu_per_s']:.1f} ms of CPU a second, "
                  f"{r['sent_per_s']:.0f} bytes sent a second; CPU per call net of that")
            continue
        for name in ("quiet", "replace"):
            w = r.get(name)
            if not w:
                continue
            lat, chg, cpu = w["latency_ms"], w["latency_changed_ms"], w["client_cpu_ms"]
            who = "SQLite, 1" if r.get("sqlite") else f"{r['hosts']} ({r['watchers']})"
            print(f"| {who} | {f(r.get('period_s', args.min_period), 1)} | {name} | {w['calls']} "
                  f"| {w['changed_calls']} | {w['errors']} "
                  f"| {'-' if r.get('sqlite') else f(w['sent_bytes_per_call'], 0)} "
                  f"| {'-' if r.get('sqlite') else f(w['etcd_cpu_ms_per_call_net'], 3)} "
                  f"| {f(lat.get('p50'))} / {f(lat.get('p90'))} / {f(lat.get('p99'))} "
                  f"| {f(chg.get('p50'))} / {f(chg.get('p99'))} | {f(cpu.get('mean'))} |")


if __name__ == "__main__":
    try:
        main()
    except KeyboardInterrupt:
        sys.exit(130)
