#!/usr/bin/env python3
"""Doxygen input filter: the headers' plain // comments as documentation.

The headers document every declaration with the // comment above it (and
members with one after them). Doxygen reads only its own comment forms, so
this filter hands it the same text in those forms: the file's opening
comment becomes the file's description, a comment block directly above a
declaration becomes that declaration's, and a comment after a member on the
same line becomes the member's. Line numbers stay as they are.
"""
import re
import sys

COMMENT = re.compile(r"^(\s*)//(?!/)\s?(.*)$")
# Characters Doxygen would read as its own commands or as HTML; the comments
# mean them literally.
SPECIAL = re.compile(r"([\\@<>&#%$])")


def literal(text):
    return SPECIAL.sub(r"\\\1", text)
TRAILING = re.compile(r"^(?P<code>[^\"/]*?[;,{])\s*//(?!/)\s?(?P<text>.*)$")


def filtered(lines):
    out = []
    opening = True
    carried = None
    for index, line in enumerate(lines):
        match = COMMENT.match(line)
        if match:
            indent, text = match.groups()
            text = literal(text)
            if opening and index == 0:
                # "\file" takes the rest of its line as a file name: it gets a
                # line of its own, and the first line's text moves to the second.
                out.append("/// \\file")
                carried = text
                continue
            if opening and carried is not None:
                text = carried + " " + text
                carried = None
            out.append(f"{indent}/// {text}")
            continue
        if carried is not None:
            out.append(f"/// {carried}")  # a one-line opening comment: one line more
            carried = None
        opening = False
        trailing = TRAILING.match(line)
        if trailing and not line.lstrip().startswith("#"):
            text = literal(trailing.group("text"))
            out.append(f"{trailing.group('code')} ///< {text}")
            continue
        out.append(line)
    return out


def main():
    with open(sys.argv[1], encoding="utf-8", errors="replace") as source:
        lines = source.read().split("\n")
    sys.stdout.write("\n".join(filtered(lines)))


if __name__ == "__main__":
    main()
