"""What the tests of the real programs share.

Every device lies in a directory of its own test, is stopped when the test ends, and its log is
shown when the test failed. One module a subject; tests take what they need from here.
"""
from .applications import APPLICATION, application, as_application, exchange_names
from .case import TestCase
from .devices import Device
from .files import label_of, read_bytes, read_file, read_text, tree
from .places import enter_own_names, run_contained
from .processes import daemons_of, has_ended, processes_naming
from .programs import BIN_DIR, is_sanitized
from .servers import AnsweringServer, free_ports, silent_server
from .sources import make_source
from .waiting import DEADLINE, wait_until

__all__ = ["APPLICATION", "BIN_DIR", "DEADLINE", "AnsweringServer", "Device", "TestCase",
           "application", "as_application", "daemons_of", "enter_own_names", "exchange_names",
           "free_ports", "has_ended", "is_sanitized", "label_of", "make_source", "processes_naming",
           "read_bytes", "read_file", "read_text", "run_contained", "silent_server", "tree",
           "wait_until"]
