"""Scripted stand-ins for the scan queue's collaborators.

Each double records the calls made on it so that tests can check what the
code under test asked of its host, and answers from state the test sets.
"""
from doubles.host import (
    FakeGuiMgr,
    FakeLocationDataCache,
    OtherDocument,
    SignalRecorder,
    make_source_editor,
)
from doubles.locations import AsyncInspectProbe, AsyncLocation, FakeLocation, LocalLocation

__all__ = [
    'AsyncInspectProbe',
    'AsyncLocation',
    'FakeGuiMgr',
    'FakeLocation',
    'FakeLocationDataCache',
    'LocalLocation',
    'OtherDocument',
    'SignalRecorder',
    'make_source_editor',
]
