"""Writes the pip configuration that pip uses inside the Debian unstable root.

Usage: python root_pip_conf.py OUT_DIR PATH_IN_ROOT

Reads this machine's pip settings as this interpreter's pip sees them (`pip config list`:
every configuration file in pip's own order, and the PIP_* variables), keeps only what
reaching the package index takes, and writes them to OUT_DIR/pip.conf; certificate files
are copied into OUT_DIR, and the configuration names them as PATH_IN_ROOT/<file>, where the
root sees OUT_DIR.

Why not copy the machine's configuration as it is: a configuration may name any local file
or folder (constraints, requirements, find-links folders, file:// indexes), which exist only
on this machine; pip inside the root then fails on the first one it cannot open. What the
machine's owner puts there is theirs to change at any time, so the root's pip is given only
the settings below, and local paths are left out (a find-links folder of wheels is a cache,
never something the tests need: the package index has everything they install).
"""

import ast
import os
import shutil
import subprocess
import sys

# Settings that concern reaching the index; everything else is left out on purpose.
URL_LISTS = {"index-url", "extra-index-url"}
FILES = {"cert", "client-cert"}
PLAIN = {"trusted-host", "proxy", "timeout", "default-timeout", "retries",
         "disable-pip-version-check"}


def host_settings():
    """(section, key) -> value, as `pip config list` prints them; environment variables
    (":env:") override the same key of every section, as they do for pip."""
    try:
        listed = subprocess.run([sys.executable, "-m", "pip", "config", "list"],
                                capture_output=True, text=True, timeout=120, check=True).stdout
    except (OSError, subprocess.SubprocessError) as error:
        print(f"root_pip_conf: cannot read this machine's pip settings ({error}); "
              "the root's pip uses its defaults", file=sys.stderr)
        return {}
    files, env = {}, {}
    for line in listed.splitlines():
        name, sep, raw = line.partition("=")
        section, dot, key = name.rpartition(".")
        if not sep or not dot:
            continue
        try:
            value = ast.literal_eval(raw)
        except (ValueError, SyntaxError):
            continue
        if section == ":env:":
            env[key] = value
        else:
            files[(section, key)] = value
    for (section, key) in list(files):
        if key in env:
            files[(section, key)] = env[key]
    for key, value in env.items():
        files.setdefault(("global", key), value)
    return files


def remote_urls(value):
    return [url for url in str(value).split() if url.startswith(("http://", "https://"))]


def kept_settings(settings, out_dir, path_in_root):
    kept, copied = {}, {}
    for (section, key), value in sorted(settings.items(), key=lambda kv: kv[0][0] != "global"):
        if key in URL_LISTS:
            urls = remote_urls(value)
            if urls:
                kept[(section, key)] = " ".join(urls)
        elif key in FILES:
            source = os.path.realpath(str(value))
            if not os.path.isfile(source):
                continue
            if source not in copied:
                # The first bundle is cert.pem: the root's commands trust it (tools/lib.sh).
                name = f"{key}.pem" if not copied else f"{key}-{len(copied)}.pem"
                shutil.copyfile(source, os.path.join(out_dir, name))
                copied[source] = f"{path_in_root}/{name}"
            kept[(section, key)] = copied[source]
        elif key in PLAIN:
            kept[(section, key)] = str(value)
    return kept


def write_config(kept, out_dir):
    sections = {}
    for (section, key), value in kept.items():
        sections.setdefault(section, []).append(f"{key} = {value}")
    lines = ["# Written by tools/root_pip_conf.py from this machine's pip settings:",
             "# only what reaching the package index takes (no local files or folders)."]
    for section in sorted(sections, key=lambda s: (s != "global", s)):
        lines += ["", f"[{section}]", *sections[section]]
    with open(os.path.join(out_dir, "pip.conf"), "w", encoding="utf-8") as out:
        out.write("\n".join(lines) + "\n")


def main():
    if len(sys.argv) != 3:
        sys.exit(__doc__.split("\n\n")[1])
    out_dir, path_in_root = sys.argv[1], sys.argv[2].rstrip("/")
    shutil.rmtree(out_dir, ignore_errors=True)
    os.makedirs(out_dir)
    write_config(kept_settings(host_settings(), out_dir, path_in_root), out_dir)


if __name__ == "__main__":
    main()
