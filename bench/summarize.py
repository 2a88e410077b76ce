#!/usr/bin/env python3
"""Turns the per-round hyperfine exports of bench/compare and bench/scaling
into one JSON file (every round kept) and a Markdown table.

summarize.py --show-round FILE
    one line for one round's export (progress output)
summarize.py --from-json FILE --markdown OUT
    the table again, from a results file
summarize.py --raw DIR --json OUT --markdown OUT [--meta KEY=VALUE ...]
    DIR holds CASE-ROUND.json exports (and, for the scaling runs,
    CASE.COMMAND.rss files of peak RSS in KiB, one line per run in round
    order, from /usr/bin/time -f %M -a)

The ratio of a case is computed per round (the commands of one round ran
one after the other, so they share the machine's state) and the median of
those ratios is the result. Standard library only.
"""
import argparse
import glob
import json
import os
import re
import statistics
import sys

GIB = 1 << 30

# Ratios of one case: (label, numerator command, denominator command,
# goal limit or None, goal text). A ratio meets its goal when <= limit.
COMPARE = {
    "copy-tree": ("Copy of the tree, disk to disk", [
        ("ours / cp -a", "ours", "cp -a", 0.9, "at most 0.9x cp -a"),
    ]),
    "remove": ("Removal of the tree, disk", [
        ("ours / rm -rf", "ours", "rm -rf", 0.6, "at most 0.6x rm -rf"),
    ]),
    "copy-tree-xvol": ("Copy of the tree, disk to /dev/shm", [
        ("ours / cp -a", "ours", "cp -a", 0.6, "at most 0.6x cp -a"),
    ]),
    "copy-file": ("Copy of a 1 GiB file, disk to disk", [
        ("ours / cp -a", "ours", "cp -a", 1.05, "within 1.05x of cp -a"),
    ]),
    "digest": ("SHA-256 of a 1 GiB file", [
        ("ours / openssl dgst -sha256", "ours", "openssl dgst -sha256", 1.0,
         "throughput at least 1.0x openssl (time ratio <= 1.0)"),
        ("ours / sha256sum", "ours", "sha256sum", None, ""),
    ]),
    "list": ("Listing 100,000 entries", [
        ("ours / readdir", "ours", "readdir", 1.5, "within 1.5x of a bare readdir loop"),
    ]),
    "migrate": ("Migration vs floor", [
        ("migrate / floor", "migrate", "floor", 3.0, "at most 3x the floor per application"),
    ]),
    "floor-durability": ("Floor program on 1,000 apps, durable vs not", [
        ("durable / no durability", "durable", "no durability", None, ""),
    ]),
    "data-size": ("Migration of 1,000 apps, 64 MiB vs 1 KiB of user data each", [
        ("64 MiB / 1 KiB", "migrate 64 MiB", "migrate 1 KiB", 1.2, "within 1.2x"),
    ]),
}


def scale_case(name):
    match = re.fullmatch(r"scale-(\d+)", name)
    return int(match.group(1)) if match else None


def ratios_for(case):
    if case in COMPARE:
        return COMPARE[case]
    apps = scale_case(case)
    if apps is not None:
        return ("Migration of %s applications" % format(apps, ","), [
            ("migrate / floor", "migrate", "floor", 3.0, "at most 3x the floor per application"),
        ])
    return (case, [])


def load_round(path):
    with open(path) as f:
        data = json.load(f)
    out = {}
    for position, result in enumerate(data["results"]):
        out[result["command"]] = {
            "position": position,
            # The median of the round's runs of the command (usually one).
            "seconds": result["median"],
            "runs": result["times"],
            "user": result["user"],
            "system": result["system"],
            "exitCode": (result.get("exit_codes") or [0])[0],
        }
    return out


def show_round(path):
    case, rnd = re.fullmatch(r"(.*)-(\d+)\.json", os.path.basename(path)).groups()
    times = load_round(path)
    parts = ["%s %.3f s" % (name, value["seconds"]) for name, value in times.items()]
    print("  %-15s round %2s: %s" % (case, rnd, ", ".join(parts)), flush=True)


def median(values):
    return statistics.median(values) if values else None


def summarize(raw, meta):
    cases = {}
    for path in sorted(glob.glob(os.path.join(raw, "*.json"))):
        match = re.fullmatch(r"(.*)-(\d+)\.json", os.path.basename(path))
        if not match:
            continue
        case, rnd = match.group(1), int(match.group(2))
        cases.setdefault(case, {})[rnd] = load_round(path)

    summary = {"meta": meta, "cases": {}}
    for case, rounds in cases.items():
        order = sorted(rounds)
        title, ratio_specs = ratios_for(case)
        commands = {}
        for rnd in order:
            for name, value in rounds[rnd].items():
                entry = commands.setdefault(name, {"seconds": [], "user": [], "system": [], "rounds": []})
                entry["seconds"].append(value["seconds"])
                entry["user"].append(value["user"])
                entry["system"].append(value["system"])
                entry["rounds"].append(rnd)
        for name, entry in commands.items():
            entry["median"] = median(entry["seconds"])
            rss_path = os.path.join(raw, "%s.%s.rss" % (case, slug(name)))
            if os.path.exists(rss_path):
                with open(rss_path) as f:
                    kib = [int(line) for line in f if line.strip().isdigit()]
                entry["peakRssKiB"] = kib
                entry["peakRssKiBMedian"] = median(kib)
        ratios = []
        for label, num, den, limit, goal in ratio_specs:
            per_round = [rounds[rnd][num]["seconds"] / rounds[rnd][den]["seconds"]
                         for rnd in order if num in rounds[rnd] and den in rounds[rnd]]
            value = median(per_round)
            # The same ratios split by which command ran first: a difference
            # between the two shows an order effect that rotation balances.
            by_order = {}
            for rnd in order:
                if num in rounds[rnd] and den in rounds[rnd]:
                    first = num if rounds[rnd][num]["position"] < rounds[rnd][den]["position"] else den
                    by_order.setdefault("%s first" % first, []).append(
                        rounds[rnd][num]["seconds"] / rounds[rnd][den]["seconds"])
            ratios.append({
                "label": label, "numerator": num, "denominator": den, "perRound": per_round,
                "median": value, "goal": goal, "limit": limit,
                "medianByOrder": {key: median(values) for key, values in by_order.items()},
                "met": None if limit is None or value is None else value <= limit,
            })
        item = {"title": title, "rounds": len(order), "commands": commands, "ratios": ratios}
        apps = scale_case(case) or (int(meta["apps"]) if case == "migrate" and "apps" in meta else None)
        if case == "data-size":
            apps = int(meta.get("data_apps", 1000))
            item["title"] = "Migration of %s apps, 64 MiB vs 1 KiB of user data each (%s files)" % (
                format(apps, ","), meta.get("data_mode", "?"))
        if apps:
            item["applications"] = apps
            item["perApplicationMs"] = {name: entry["median"] / apps * 1000 for name, entry in commands.items()}
        if case == "digest":
            item["throughputMBps"] = {name: int(meta.get("digest_bytes", GIB)) / 1e6 / entry["median"] for name, entry in commands.items()}
        summary["cases"][case] = item
    summary["derived"] = derived(summary["cases"])
    return summary


def slug(name):
    return re.sub(r"[^A-Za-z0-9]+", "-", name).strip("-")


def derived(cases):
    """Goals that span cases: linearity, the host's estimate, memory."""
    out = []
    mig = [(case["applications"], case) for name, case in cases.items()
           if (scale_case(name) or name == "migrate") and "applications" in case]
    for apps, case in sorted(mig, key=lambda pair: pair[0]):
        per_item = case["commands"]["migrate"]["median"] / apps
        out.append({
            "label": "host estimate / migration, per application, %s apps" % format(apps, ","),
            "value": 2.25 / per_item, "goal": "at least 1,000x inside 2.25 s per item",
            "met": 2.25 / per_item >= 1000,
        })
    if "scale-1000" in cases and "scale-10000" in cases:
        for command in ("migrate", "floor"):
            ratio = cases["scale-10000"]["commands"][command]["median"] / cases["scale-1000"]["commands"][command]["median"]
            out.append({
                "label": "%s: time at 10,000 / time at 1,000 (medians)" % command, "value": ratio,
                "goal": "within 12x (linear)" if command == "migrate" else "", "met": ratio <= 12 if command == "migrate" else None,
            })
        rss = {n: cases["scale-%d" % n]["commands"]["migrate"].get("peakRssKiBMedian") for n in (1000, 10000)}
        if all(rss.values()):
            out.append({
                "label": "migrate: peak RSS growth per application, 1,000 to 10,000 (KiB)",
                "value": (rss[10000] - rss[1000]) / 9000, "goal": "no more than the item list", "met": None,
            })
    if "data-size" in cases:
        commands = cases["data-size"]["commands"]
        small, large = (commands.get(n, {}).get("peakRssKiBMedian") for n in ("migrate 1 KiB", "migrate 64 MiB"))
        if small and large:
            out.append({
                "label": "migrate: peak RSS, 64 MiB / 1 KiB per application", "value": large / small,
                "goal": "independent of file size", "met": None,
            })
    return out


def fmt(value, digits=3):
    return "-" if value is None else ("%.*f" % (digits, value))


def markdown(summary):
    lines = []
    meta = summary["meta"]
    lines.append("Measured %s on %s (commit %s, %s); %s rounds%s." % (
        meta.get("date", "?"), meta.get("host", "?"), meta.get("commit", "?"), meta.get("worktree", "?"),
        meta.get("rounds", "?"), "; load at the end %s" % meta["load"] if "load" in meta else ""))
    lines.append("")
    lines.append("| Case | Rounds | Medians (s) | Ratio | Median of per-round ratios (min-max) | Goal | Met |")
    lines.append("|---|---|---|---|---|---|---|")
    for name, case in summary["cases"].items():
        medians = ", ".join("%s %s" % (cmd, fmt(entry["median"])) for cmd, entry in case["commands"].items())
        for ratio in case["ratios"] or [{"label": "", "perRound": [], "median": None, "goal": "", "met": None}]:
            spread = ("%s-%s" % (fmt(min(ratio["perRound"])), fmt(max(ratio["perRound"])))
                      if ratio["perRound"] else "")
            met = {True: "yes", False: "**no**", None: ""}[ratio["met"]]
            lines.append("| %s | %d | %s | %s | %s (%s) | %s | %s |" % (
                case["title"], case["rounds"], medians, ratio["label"], fmt(ratio["median"]), spread,
                ratio["goal"], met))
    extra = []
    for name, case in summary["cases"].items():
        for ratio in case["ratios"]:
            if len(ratio.get("medianByOrder", {})) == 2:
                extra.append("%s, %s: median by order: %s" % (case["title"], ratio["label"], ", ".join(
                    "%s %s" % (key, fmt(v)) for key, v in sorted(ratio["medianByOrder"].items()))))
        if "throughputMBps" in case:
            extra.append("Digest throughput (MB/s, from the medians): " + ", ".join(
                "%s %.0f" % (cmd, v) for cmd, v in case["throughputMBps"].items()))
        if "perApplicationMs" in case:
            extra.append("%s, per application (ms): %s" % (case["title"], ", ".join(
                "%s %.3f" % (cmd, v) for cmd, v in case["perApplicationMs"].items())))
        for cmd, entry in case["commands"].items():
            if "peakRssKiBMedian" in entry:
                extra.append("%s, %s: peak RSS %s KiB (median)" % (case["title"], cmd, fmt(entry["peakRssKiBMedian"], 0)))
    for item in summary["derived"]:
        met = {True: "met", False: "**not met**", None: ""}[item["met"]]
        goal = "; ".join(part for part in (item["goal"] and "goal: " + item["goal"], met) if part)
        extra.append("%s: %s%s" % (item["label"], fmt(item["value"], 2), " (%s)" % goal if goal else ""))
    if extra:
        lines.append("")
        lines.extend("- " + line for line in extra)
    return "\n".join(lines) + "\n"


def main():
    parser = argparse.ArgumentParser()
    parser.add_argument("--show-round")
    parser.add_argument("--from-json")
    parser.add_argument("--raw")
    parser.add_argument("--json")
    parser.add_argument("--markdown")
    parser.add_argument("--meta", nargs="*", default=[])
    args = parser.parse_args()
    if args.show_round:
        show_round(args.show_round)
        return
    if args.from_json and args.markdown:
        with open(args.from_json) as f:
            summary = json.load(f)
        with open(args.markdown, "w") as f:
            f.write(markdown(summary))
        return
    if not (args.raw and args.json and args.markdown):
        parser.error("--raw, --json and --markdown are needed")
    meta = {}
    for item in args.meta:
        key, _, value = item.partition("=")
        meta[key] = value
    meta.setdefault("host", os.uname().nodename)
    import datetime
    meta.setdefault("date", datetime.datetime.now(datetime.timezone.utc).strftime("%Y-%m-%d %H:%M UTC"))
    summary = summarize(args.raw, meta)
    if not summary["cases"]:
        sys.exit("summarize.py: no rounds in %s" % args.raw)
    with open(args.json, "w") as f:
        json.dump(summary, f, indent=1)
        f.write("\n")
    with open(args.markdown, "w") as f:
        f.write(markdown(summary))


if __name__ == "__main__":
    main()
