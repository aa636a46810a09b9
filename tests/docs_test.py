#!/usr/bin/env python3
"""The documentation's links lead somewhere, and the files that it names are there.  docs_test.py SOURCE-FOLDER"""

import glob
import os
import re
import sys

root = os.path.abspath(sys.argv[1])
pages = sorted(glob.glob(f"{root}/*.md") + glob.glob(f"{root}/docs/*.md"))
names = {name for folder, _, files in os.walk(root) if f"{root}/build" not in folder for name in files}
faults = []


def anchors(page):
    """As they are made of the headings: lower case, without punctuation, "-" for blanks."""
    headings = re.findall(r"^#+ (.*)", open(page).read(), re.M)
    return {re.sub(r"[^\w\- ]", "", heading.lower()).replace(" ", "-") for heading in headings}


for page in pages:
    text = open(page).read()
    for target, anchor in re.findall(r"\]\((?!\w+:)([^)#]*)#?([^)]*)\)", text):
        path = os.path.normpath(os.path.join(os.path.dirname(page), target)) if target else page
        if not os.path.exists(path):
            faults.append(f"{page}: there is no {target}")
        elif anchor and anchor not in anchors(path):
            faults.append(f"{page}: {target} has no heading #{anchor}")
        # The pages are installed without the rest of the tree.
        elif "/docs/" in page and "/docs/" not in path:
            faults.append(f"{page}: {target} is outside of docs/")
    for name in re.findall(r"`([\w/.*-]+\.(?:cpp|h|py|bash|cmake))`", text):
        there = glob.glob(f"{root}/{name}") if "/" in name else name in names
        if not there and not glob.glob(f"{root}/*/include/{name}"):
            faults.append(f"{page}: there is no {name}")
    for table in re.findall(r"(?:^\|.*\n)+", text, re.M):
        # A "|" that belongs to a cell is written with a backslash.
        columns = {len(re.findall(r"(?<!\\)\|", row)) for row in table.splitlines()}
        if len(columns) > 1:
            faults.append(f"{page}: rows of different length below {table.splitlines()[0]}")

print("\n".join(faults))
sys.exit(bool(faults))
