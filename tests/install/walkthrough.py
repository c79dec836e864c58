"""Turns a page of documentation into the script that its reader would carry out.

A fenced block below a line that holds nothing but a file name, **main.cc**, is written to that file. A block of
the language `sh` without a name is run; where nothing but empty lines stands between it and a block of the
language `text`, it must print that. All other blocks are only read. Files are written and commands run in the
order of the page, in one shell, in one empty directory.
"""

import re
import shlex

_NAME = re.compile(r"\*\*([^*]+)\*\*$")
_FENCE = re.compile(r"```([a-z]*)$")
_END = "END-OF-THIS-FILE"


def blocks(text):
    """The fenced blocks of a page: line number, language, file name or None, whether nothing but empty lines
    stands between it and the block before, content."""
    found = []
    name, start, language, content, follows = None, None, None, [], False
    for number, line in enumerate(text.splitlines(), 1):
        if start is not None:
            if line == "```":
                found.append((start, language, name, follows, "".join(content)))
                start, name, content, follows = None, None, [], True
            else:
                content.append(line + "\n")
        elif fence := _FENCE.match(line):
            start, language = number, fence[1]
        elif line.strip():
            named = _NAME.match(line.strip())
            name, follows = named[1] if named else None, False
    if start is not None:
        raise ValueError(f"the block that begins in line {start} has no end")
    return found


def script(text):
    """The page as a bash script that stops at the first command that fails, and says which block that was."""
    lines = [
        "set -euo pipefail",
        "exec 3>&1",
        'failed() { cat "$TMPDIR/printed" >&3; echo "the block that begins in line $block failed" >&2; }',
        "trap failed ERR",
    ]
    commands, before = 0, None
    for number, language, name, follows, content in blocks(text):
        if name is not None:
            if name.startswith("/") or ".." in name.split("/"):
                raise ValueError(f"line {number}: the file {name} lies outside the reader's directory")
            path = shlex.quote(name)
            lines += [f'mkdir -p "$(dirname {path})"', f"cat >{path} <<'{_END}'", content + _END]
        elif language == "sh":
            lines += [f"block={number}", 'exec >"$TMPDIR/printed"', content, 'exec >&3; cat "$TMPDIR/printed"']
            commands += 1
        elif language == "text" and follows and before == "sh":
            lines += [f"""diff - "$TMPDIR/printed" >&2 <<'{_END}'""", content + _END]
        before = language if name is None else None
    if not commands:
        raise ValueError("the page has no commands to run")
    return "\n".join(lines) + "\n"
