"""Shared test set-up: make the stand-in host and the built extensions importable.

`./run test` already puts them on PYTHONPATH; this keeps a bare `pytest` run in a
prepared checkout working too (build/ext must exist: `./run build`).
"""
import os
import sys
from pathlib import Path

ROOT = Path(__file__).resolve().parent.parent
_ext = os.environ.get("PYSOURCE_EXT_DIR", str(ROOT / "build" / "ext"))
for p in (str(ROOT / "standin"), _ext, str(ROOT / "tests")):
    if p not in sys.path:
        sys.path.insert(0 if p.endswith("standin") else len(sys.path), p)

import pytest

# Shared fixture and double modules get pytest's assertion rewriting too.
pytest.register_assert_rewrite("scanqueue_fixtures", "coord_doubles", "scan_doubles")
