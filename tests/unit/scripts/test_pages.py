"""The pages: every link leads somewhere, and each rule of behaviour has one place, which exists."""

import glob
import os
import re
import unittest

ROOT = os.path.dirname(os.path.dirname(os.path.dirname(os.path.dirname(os.path.abspath(__file__)))))
PAGES = sorted(glob.glob(os.path.join(ROOT, "*.md")) + glob.glob(os.path.join(ROOT, "docs", "*.md"))
               + [os.path.join(ROOT, "tests", "README.md")])


def read(path):
    with open(path, encoding="utf-8") as file:
        return file.read()


def anchors(path):
    """What a link behind a # may name: the page's headings, as sites that show it make them."""
    headings = re.findall(r"^#+ +(.*)$", read(path), re.MULTILINE)
    return {re.sub(r"[^\w\- ]", "", heading.lower()).replace(" ", "-") for heading in headings}


class Links(unittest.TestCase):
    def test_lead_to_what_there_is(self):
        lost = []
        for page in PAGES:
            text = re.sub(r"```.*?```|`[^`\n]*`", "", read(page), flags=re.DOTALL)
            for link in re.findall(r"\]\(([^)\s]+)\)", text):
                path, _, anchor = link.partition("#")
                if ":" in path:
                    continue
                target = os.path.join(os.path.dirname(page), path) if path else page
                if not os.path.exists(target) or (anchor and anchor not in anchors(target)):
                    lost.append((os.path.relpath(page, ROOT), link))
        self.assertEqual(lost, [])


class WhereIs(unittest.TestCase):
    def test_each_rule_has_one_place(self):
        table = read(os.path.join(ROOT, "CONTRIBUTING.md")).partition("## Where is ...")[2]
        rows = re.findall(r"^\| (?!rule of|---)(.*?) \| (.*) \|$", table, re.MULTILINE)
        self.assertGreaterEqual(len(rows), 20)
        for rule, place in rows:
            with self.subTest(rule):
                self.assertRegex(place, r"^`[^`]+`$")
                self.assertTrue(os.path.isfile(os.path.join(ROOT, place.strip("`"))), place)


if __name__ == "__main__":
    unittest.main()
