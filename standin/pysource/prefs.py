"""Preferences of the analysis engine: names and defaults.

Values are read through the application's preference manager
(``GetSingletons().fPrefMgr``) and fall back to the defaults here.
"""
from __future__ import annotations

from typing import Any

import singleton

kPrefAnalyzeImports = 'pysource.analyze-imports'
kPrefIdleScanning = 'pysource.idle-scanning'
kPrefDatabaseDir = 'pysource.database-dir'

kDefaults: dict[str, Any] = {
    kPrefAnalyzeImports: True,
    kPrefIdleScanning: True,
    kPrefDatabaseDir: None,
}


def GetPref(name: str) -> Any:
    """The preference's value (its default when unset or no manager exists)."""
    mgr = singleton.GetSingletons().fPrefMgr
    default = kDefaults.get(name)
    if mgr is None:
        return default
    return mgr.GetPref(name, default)
