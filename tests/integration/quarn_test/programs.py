"""The programs under test: those in $QUARN_BIN_DIR."""
import os

BIN_DIR = os.environ.get("QUARN_BIN_DIR") or os.path.join(
    os.path.dirname(os.path.abspath(__file__)), "../../../build/bin")


def is_sanitized(program="quarnd"):
    """Whether what a program takes of memory is the sanitizer's."""
    with open(os.path.join(BIN_DIR, program), "rb") as file:
        content = file.read()
    return b"__asan_init" in content or b"__tsan_init" in content
