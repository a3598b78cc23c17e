"""Where the programs under test are, and how long they may take."""

import os
import pathlib

SOURCE_DIR = pathlib.Path(__file__).resolve().parents[3]


def bin_dir():
    """The folder with orvd and orvcfg, from ORV_BIN_DIR."""
    given = os.environ.get("ORV_BIN_DIR")
    if not given:
        raise RuntimeError("ORV_BIN_DIR must name the folder with orvd and orvcfg")
    return pathlib.Path(given).resolve()


def orvd():
    return bin_dir() / "orvd"


def orvcfg():
    return bin_dir() / "orvcfg"


def sanitized():
    return bool(os.environ.get("ORV_SANITIZE"))


def code_page():
    """The code page of configuration files: that of the locale that the environment names."""
    _, dot, name = os.environ.get("LC_ALL", "").partition(".")
    return name if dot else "utf-8"


def fits_code_page(text):
    try:
        return bool(text.encode(code_page())) or not text
    except UnicodeEncodeError:
        return False


# Seconds after which something that should have happened is a failure. Nothing waits this long
# unless it fails.
DEADLINE = 60.0 if sanitized() else 20.0
