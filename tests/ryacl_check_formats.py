#!/usr/bin/env python3
"""ryacl check --format=json and --format=sarif parsed and their fields checked;
with --validate, the SARIF log also passes the SARIF Multitool's `validate`
(installed by tools/deps with npm) without errors.  Exit 77: skipped."""
import json
import os
import re
import subprocess
import sys
import tempfile
import urllib.parse

SKIP = 77
ryacl = sys.argv[1]
validate = "--validate" in sys.argv[2:]
failures = []


def expect(cond, what):
    if not cond:
        failures.append(what)


def multitool():
    tool = os.environ.get("RYACL_SARIF_MULTITOOL") or os.path.join(
        os.environ.get("RYACL_TOOLS_DIR") or os.path.expanduser("~/.cache/ryacl-tools"),
        "node_modules/@microsoft/sarif-multitool-linux/Sarif.Multitool")
    return tool if os.access(tool, os.X_OK) else None


if validate and not multitool():
    print("SKIP: the SARIF Multitool is not installed (tools/deps --tests installs it with npm; "
          "the npm registry may be unreachable): the SARIF log is not validated")
    sys.exit(SKIP)

with tempfile.TemporaryDirectory() as top:
    work = os.path.join(top, "dir with space")
    os.mkdir(work)
    files = {
        "good.acl": b"o r\nu unix alice rw\n",
        "bad.acl": b"o r\nx rw\no w\ng\nu unix a r\nu UNIX A w\n",
        "t%\xc3\xa9#?.acl": b"u unix \xff\x1b r\nu unix \xff\x1b w\n",  # a name to encode, bytes that are not UTF-8
    }
    for name, text in files.items():
        with open(os.path.join(work, os.fsdecode(name)), "wb") as f:
            f.write(text)
    names = [os.fsdecode(n) for n in files] + [os.path.join(work, "bad.acl"), "missing.acl"]

    def run(fmt):
        p = subprocess.run([ryacl, "check", "--format=" + fmt] + names, cwd=work, capture_output=True,
                           env=dict(os.environ, LC_ALL="C"))
        expect(p.returncode == 2, f"{fmt}: exit status {p.returncode}, not 2 (a file is missing)")
        expect(b"missing.acl: 4471-168 " in p.stderr, f"{fmt}: the missing file is not named: {p.stderr!r}")
        return p.stdout

    # JSON: one document, a record per file in order, every diagnostic complete.
    doc = json.loads(run("json"))
    expect(doc.get("version") == 1, "json: version")
    got = doc.get("files", [])
    expect([f.get("file") for f in got] == names, f"json: files {[f.get('file') for f in got]}")
    expect([f.get("ok") for f in got] == [True, False, False, False, False], "json: ok")
    expect([f.get("entries") for f in got] == [2, 2, 1, 2, 0], f"json: entries {[f.get('entries') for f in got]}")
    expect("4471-168" in got[-1].get("error", ""), "json: the missing file's error")
    for f in got:
        for d in f.get("diagnostics", []):
            expect(set(d) == {"line", "id", "number", "rc", "severity", "message"}, f"json: keys {sorted(d)}")
            expect(re.fullmatch(r"4471-\d{3}", d["id"]) and d["number"] == int(d["id"][5:]), f"json: id {d}")
            expect(d["message"].startswith(d["id"] + " ") and d["severity"] == "error", f"json: {d}")
            expect(isinstance(d["line"], int) and d["line"] >= 1 and d["rc"] in (36, 37, 42, 43), f"json: {d}")
    bad = got[1]["diagnostics"]
    expect([(d["line"], d["number"], d["rc"]) for d in bad] == [(2, 179, 42), (3, 174, 43), (4, 172, 42), (6, 157, 43)],
           f"json: bad.acl {[(d['line'], d['number'], d['rc']) for d in bad]}")
    expect(got[2]["diagnostics"][0]["message"].count("identity: \\xff\\x1b.") == 1, "json: bytes of the identity")

    # SARIF: one run, a rule per id used, results pointing at the files.
    raw = run("sarif")
    log = json.loads(raw)
    expect("$schema" in log and log.get("version") == "2.1.0", "sarif: $schema and version")
    runs = log.get("runs", [])
    expect(len(runs) == 1, "sarif: one run")
    driver = runs[0]["tool"]["driver"]
    expect(driver.get("name") == "ryacl", "sarif: driver name")
    rules = [r["id"] for r in driver.get("rules", [])]
    results = runs[0].get("results", [])
    expect(len(rules) == len(set(rules)) and set(rules) == {r["ruleId"] for r in results}, f"sarif: rules {rules}")
    expect(len(results) == sum(len(f["diagnostics"]) for f in got), "sarif: one result per diagnostic")
    for r in results:
        loc = r["locations"][0]["physicalLocation"]
        uri = loc["artifactLocation"]["uri"]
        path = urllib.parse.unquote(uri[len("file://"):] if uri.startswith("file://") else uri)
        expect(path in names and (uri.startswith("file:///") == path.startswith("/")), f"sarif: uri {uri}")
        expect(re.fullmatch(r"[A-Za-z0-9/._~%:-]+", uri), f"sarif: uri not encoded: {uri}")
        expect(rules[r["ruleIndex"]] == r["ruleId"] and r["level"] == "error", f"sarif: {r['ruleId']}")
        expect(r["message"]["text"].startswith(r["ruleId"]) and loc["region"]["startLine"] >= 1, "sarif: result")
    notes = runs[0]["invocations"][0]["toolExecutionNotifications"]
    expect(len(notes) == 1 and runs[0]["invocations"][0]["executionSuccessful"] is False, "sarif: the missing file")

    if validate:
        with open(os.path.join(top, "log.sarif"), "wb") as f:
            f.write(raw)
        tool = multitool()
        schema = os.path.join(os.path.dirname(tool), "sarif-2.1.0.json")
        p = subprocess.run([tool, "validate", "-j", schema, os.path.join(top, "log.sarif")], capture_output=True,
                           text=True, timeout=600)
        out = p.stdout + p.stderr
        errors = [line for line in out.splitlines() if re.search(r": error [A-Z]+\d+:", line)]
        expect("Analysis completed successfully" in out, f"sarif validate did not complete: {out}")
        expect(not errors, "sarif validate: " + "\n".join(errors))

for f in failures:
    print("FAIL:", f)
sys.exit(1 if failures else 0)
