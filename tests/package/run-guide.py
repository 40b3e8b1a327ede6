#!/usr/bin/python3
"""Runs a guide of docs/ literally, as a user would follow it, so that the guide cannot rot.

    run-guide.py --user USER GUIDE.md

In a fresh directory in USER's home, in the guide's order:
  - a fenced block after `<!-- file: PATH -->` is written to PATH (the user's file);
  - each line of a fenced block after `<!-- run -->` is a command for USER's shell, run in that
    directory; `sudo COMMAND` runs COMMAND as root, with `~` still the user's home;
  - `<!-- expect: TEXT -->` checks that the output of the block before it holds TEXT.
Other blocks are for reading. The first failure ends the run with what the command printed."""

import argparse
import os
import pathlib
import pwd
import re
import subprocess
import sys

MARK = re.compile(r"<!-- (file|run|expect):?\s*(.*?)\s*-->")


def steps(text):
    """(kind, argument, block) in the guide's order."""
    lines = text.splitlines()
    i = 0
    while i < len(lines):
        m = MARK.fullmatch(lines[i].strip())
        i += 1
        if not m:
            continue
        kind, argument = m.groups()
        if kind == "expect":
            yield kind, argument, ""
            continue
        while i < len(lines) and not lines[i].startswith("```"):
            i += 1
        start = i + 1
        end = start
        while end < len(lines) and not lines[end].startswith("```"):
            end += 1
        yield kind, argument, "\n".join(lines[start:end]) + "\n"
        i = end + 1


def main():
    parser = argparse.ArgumentParser()
    parser.add_argument("--user", required=True)
    parser.add_argument("guide")
    args = parser.parse_args()
    user = pwd.getpwnam(args.user)
    home = pathlib.Path(user.pw_dir)
    work = home / ("guide-" + pathlib.Path(args.guide).stem)
    subprocess.run(["runuser", "-u", args.user, "--", "rm", "-rf", str(work)], check=True)
    subprocess.run(["runuser", "-u", args.user, "--", "mkdir", "-p", str(work)], check=True)
    environment = {"HOME": str(home), "XDG_RUNTIME_DIR": f"/run/user/{user.pw_uid}", "PATH": "/usr/bin:/bin",
                   "LANG": "C.UTF-8", "USER": args.user}
    output = ""
    count = 0
    for kind, argument, block in steps(pathlib.Path(args.guide).read_text()):
        count += 1
        if kind == "file":
            path = work / argument
            subprocess.run(["runuser", "-u", args.user, "--", "mkdir", "-p", str(path.parent)], check=True)
            subprocess.run(["runuser", "-u", args.user, "--", "tee", str(path)], input=block, text=True,
                           stdout=subprocess.DEVNULL, check=True)
        elif kind == "run":
            output = ""
            for command in block.splitlines():
                if not command.strip():
                    continue
                print(f"$ {command}", flush=True)
                if command.startswith("sudo "):
                    argv = ["env", "-i", *[f"{k}={v}" for k, v in environment.items()], "bash", "-c", command[5:]]
                else:
                    argv = ["runuser", "-u", args.user, "--", "env", "-i",
                            *[f"{k}={v}" for k, v in environment.items()], "bash", "-c", command]
                done = subprocess.run(argv, cwd=work, capture_output=True, text=True)
                print(done.stdout + done.stderr, end="", flush=True)
                output += done.stdout + done.stderr
                if done.returncode != 0:
                    sys.exit(f"run-guide: `{command}` exited with {done.returncode}")
        elif argument not in output:
            sys.exit(f"run-guide: the output does not hold {argument!r}")
    if count == 0:
        sys.exit("run-guide: the guide has no step")
    print(f"run-guide: {count} steps of {args.guide} ran as {args.user}")


if __name__ == "__main__":
    main()
