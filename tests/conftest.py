"""Shared set-up: the stand-in host, the built extensions (also for a bare
`pytest` after `./run build`) and the reference queue importable; a fresh main
loop and fresh singletons around every test."""
import os
import sys
from pathlib import Path

ROOT = Path(__file__).resolve().parent.parent
_ext = os.environ.get("PYSOURCE_EXT_DIR", str(ROOT / "build" / "ext"))
for p in (str(ROOT / "standin"), _ext, str(ROOT / "tests"), str(ROOT / "bench")):
    if p not in sys.path:
        sys.path.insert(0 if p.endswith("standin") else len(sys.path), p)

import pytest

pytest.register_assert_rewrite("queue_helpers", "coord_doubles")

import singleton
from coord_doubles import coord, host  # noqa: F401 - fixtures
from guiutils import ostrelgtk
from queue_helpers import async_probe, data_cache, impl, queue, signals  # noqa: F401 - fixtures


@pytest.fixture(autouse=True)
def clean_host():
    ostrelgtk.reset()
    singleton.ResetSingletons()
    yield
    ostrelgtk.reset()
    singleton.ResetSingletons()
