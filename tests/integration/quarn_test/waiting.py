"""Waiting for what must happen."""
import time

#: How long a test waits for what must happen, in seconds; sanitizers are slow.
DEADLINE = 60


def wait_until(condition, what, deadline=DEADLINE):
    """Poll until `condition()` is true; its value is returned."""
    end = time.monotonic() + deadline
    while True:
        value = condition()
        if value:
            return value
        if time.monotonic() > end:
            raise AssertionError("did not happen in %d s: %s" % (deadline, what))
        time.sleep(0.02)
