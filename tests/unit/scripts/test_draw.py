"""scripts/draw: the committed drawings are those of their source, and show the floors there are."""

import os
import shutil
import subprocess
import tempfile
import unittest
import xml.dom.minidom

ROOT = os.path.dirname(os.path.dirname(os.path.dirname(os.path.dirname(os.path.abspath(__file__)))))
SCRIPT = os.path.join(ROOT, "scripts", "draw")
FLOORS = """
[floors]
"upper" = { files = ["upper/*"], sees = ["lower"] }
"lower" = { files = ["lower/*"], sees = [] }
[stacks.house]
sees = []
floors = [{ name = "roof", files = ["roof/*"] }, { name = "cellar", files = ["cellar/*"] }]
"""
DRAWINGS = """
[house]
columns = 2
stack = "house"
notes = [["roof", "dry"], ["cellar", "cool"]]
[ways]
columns = 2
boxes = [
  { row = 0, column = 0, span = 2, name = "up", note = "a <note>", floor = "upper" },
  { row = 1, column = 0, span = 2, name = "down", note = "", floor = "lower" },
]
arrows = [["up", "down", "stairs"]]
"""


def draw(*arguments):
    return subprocess.run([SCRIPT, *arguments], capture_output=True, text=True, check=False)


class Repository(unittest.TestCase):
    def test_shows_what_is_true(self):
        checked = draw("--check")
        self.assertEqual((checked.stdout, checked.returncode), ("", 0))


class Drawings(unittest.TestCase):
    def setUp(self):
        self.root = tempfile.mkdtemp()
        self.addCleanup(shutil.rmtree, self.root)
        self.write("scripts/floors.toml", FLOORS)
        self.write("docs/drawings/drawings.toml", DRAWINGS)
        self.assertEqual(draw(self.root).returncode, 0)

    def write(self, path, text):
        path = os.path.join(self.root, path)
        os.makedirs(os.path.dirname(path), exist_ok=True)
        with open(path, "w", encoding="utf-8") as file:
            file.write(text)

    def assert_told(self, *lines):
        checked = draw("--check", self.root)
        self.assertEqual(checked.stdout.splitlines(), list(lines))
        self.assertEqual(checked.returncode, 1 if lines else 0)

    def test_are_made(self):
        self.assert_told()
        drawing = xml.dom.minidom.parse(os.path.join(self.root, "docs/drawings/ways.svg"))
        texts = [text.firstChild.data for text in drawing.getElementsByTagName("text")
                 if text.firstChild]
        self.assertEqual(texts, ["up", "a <note>", "down", "stairs"])
        self.assertEqual(len(drawing.getElementsByTagName("line")), 1)

    def test_of_another_source_are_told(self):
        self.write("docs/drawings/drawings.toml", DRAWINGS.replace("cool", "warm"))
        self.assert_told("docs/drawings/house.svg: not what scripts/draw makes of its source")

    def test_without_a_word_on_a_floor_are_told(self):
        self.write("scripts/floors.toml", FLOORS.replace('"cellar"', '"vault"'))
        self.assert_told('house: the floor "vault" has no note',
                         'house: a note on "cellar", which is no floor',
                         "docs/drawings/house.svg: not what scripts/draw makes of its source")

    def test_with_an_arrow_to_what_is_not_seen_are_told(self):
        self.write("scripts/floors.toml", FLOORS.replace('sees = ["lower"]', "sees = []"))
        self.assert_told('ways: an arrow from "upper" to "lower", which it does not see')

    def test_of_the_transport_that_lack_one_of_its_floors_are_told(self):
        for path, text in (("scripts/floors.toml", FLOORS),
                           ("docs/drawings/drawings.toml", DRAWINGS)):
            self.write(path, text.replace('"upper"', '"transport upper"').replace(
                '"lower"] }', '"lower", "transport other"] }'))
        self.assertEqual(draw(self.root).stdout,
                         'ways: no arrow from "transport upper" to "transport other", '
                         "which it sees\n")


if __name__ == "__main__":
    unittest.main()
