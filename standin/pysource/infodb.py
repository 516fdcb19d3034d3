"""The information cache's database: one sqlite file per project.

Design note
-----------
What a session needs at start is small: which scans are recorded for which file
at which modification time.  What a file's scopes, imports and derived
information hold is needed only when that file is asked about.  The tables
follow that split:

- ``files (id, url, scans, nscopes)``: one short row per file, read whole at
  start (``LoadIndex``).  ``url`` is the location's URL as UTF-8 bytes (with
  surrogate escapes, so undecodable file names survive); ``scans`` is a JSON
  object scan name -> modification time; ``nscopes`` the number of scopes
  stored (for statistics only).
- ``contents (id, imports, data, deps)``: the rest of a file, read per file on
  first use.  ``data`` is the zlib-compressed JSON of the file's scopes and
  derived information (its layout belongs to ``scopeinfo``); ``imports`` the
  compressed JSON list of (scope name, import equivalent) pairs, kept apart so
  that the whole-file check of an unchanged file does not need ``data``;
  ``deps`` the comma-separated ids of the files its derived information used.
  The reverse relation (who depends on a file) is built from ``deps`` only when
  a file's information actually changes (``ReadAllDeps``).
- ``meta (key, value)``: the format number.  A database of another format is
  emptied and rebuilt: it is a cache.

A write (``Write``) is one transaction (``BEGIN IMMEDIATE`` ... ``COMMIT``); on
any error it is rolled back, so the file is always in the state of the last
complete write.  Errors reach the caller as ``CDatabaseError`` with a one-line
message.
"""
from __future__ import annotations

import json
import os
import sqlite3
import zlib
from collections.abc import Iterable
from typing import Any

kFormat = '2'
kBusyTimeout = 2.0
kCompressLevel = 6

_kSchema = (
    'CREATE TABLE IF NOT EXISTS meta (key TEXT PRIMARY KEY, value TEXT) WITHOUT ROWID',
    ('CREATE TABLE IF NOT EXISTS files (id INTEGER PRIMARY KEY, url BLOB NOT NULL,'
     ' scans TEXT NOT NULL, nscopes INTEGER NOT NULL)'),
    ('CREATE TABLE IF NOT EXISTS contents (id INTEGER PRIMARY KEY, imports BLOB,'
     ' data BLOB, deps TEXT)'),
)


class CDatabaseError(Exception):
    """A database that cannot be used; ``str()`` is a one-line message."""


def UrlToBlob(url: str) -> bytes:
    return url.encode('utf-8', 'surrogateescape')


def BlobToUrl(blob: bytes) -> str:
    return bytes(blob).decode('utf-8', 'surrogateescape')


def Pack(obj: Any) -> bytes:
    """Compressed JSON; strings may hold surrogate escapes (undecodable names)."""
    text = json.dumps(obj, ensure_ascii=False, separators=(',', ':'))
    return zlib.compress(text.encode('utf-8', 'surrogatepass'), kCompressLevel)


def Unpack(blob: bytes) -> Any:
    return json.loads(zlib.decompress(blob).decode('utf-8', 'surrogatepass'))


def _Describe(exc: BaseException, path: str) -> str:
    text = str(exc)
    if 'locked' in text or 'busy' in text:
        return f'database is locked by another process: {path}'
    if 'readonly' in text or 'read-only' in text:
        return f'database is read-only: {path}'
    if 'not a database' in text or 'malformed' in text or 'file is encrypted' in text:
        return f'not a database written by this tool: {path}'
    if isinstance(exc, OSError):
        return f'cannot use the database {path}: {exc.strerror or exc}'
    return f'database error ({text}): {path}'


class CInfoDatabase:
    """One open database file (see the module note)."""

    def __init__(self, path: str) -> None:
        self.fPath = path
        self.fRebuilt = False
        self._fConn: sqlite3.Connection | None = None

    # -- opening -------------------------------------------------------------------

    def Open(self) -> None:
        """Open (creating when missing) and check the format; idempotent."""
        if self._fConn is not None:
            return
        try:
            directory = os.path.dirname(os.path.abspath(self.fPath))
            os.makedirs(directory, exist_ok=True)
            conn = sqlite3.connect(self.fPath, timeout=kBusyTimeout, isolation_level=None)
        except (OSError, sqlite3.Error) as exc:
            raise CDatabaseError(_Describe(exc, self.fPath)) from None
        try:
            self._CheckFormat(conn)
        except sqlite3.Error as exc:
            conn.close()
            raise CDatabaseError(_Describe(exc, self.fPath)) from None
        self._fConn = conn

    def _CheckFormat(self, conn: sqlite3.Connection) -> None:
        tables = {row[0] for row in conn.execute(
            "SELECT name FROM sqlite_master WHERE type = 'table'")}
        fmt = None
        if 'meta' in tables:
            row = conn.execute("SELECT value FROM meta WHERE key = 'format'").fetchone()
            fmt = row[0] if row else None
        if tables and fmt != kFormat:
            # Written by another version: start again (the scans are redone).
            conn.execute('BEGIN IMMEDIATE')
            for name in tables:
                if not name.startswith('sqlite_'):
                    conn.execute(f'DROP TABLE "{name}"')
            conn.execute('COMMIT')
            conn.execute('VACUUM')
            self.fRebuilt = True
            tables = set()
        if not tables:
            conn.execute('BEGIN IMMEDIATE')
            for stmt in _kSchema:
                conn.execute(stmt)
            conn.execute("INSERT OR REPLACE INTO meta VALUES ('format', ?)", (kFormat,))
            conn.execute('COMMIT')

    def Close(self) -> None:
        if self._fConn is not None:
            self._fConn.close()
            self._fConn = None

    def _Conn(self) -> sqlite3.Connection:
        self.Open()
        assert self._fConn is not None
        return self._fConn

    def _Query(self, sql: str, args: Iterable[Any] = ()) -> list[tuple]:
        try:
            return self._Conn().execute(sql, tuple(args)).fetchall()
        except sqlite3.Error as exc:
            raise CDatabaseError(_Describe(exc, self.fPath)) from None

    # -- reading -------------------------------------------------------------------

    def LoadIndex(self) -> dict[str, tuple[int, dict[str, float], int]]:
        """url -> (id, scans done (name -> modification time), number of scopes)."""
        loads = json.loads
        return {BlobToUrl(url): (fid, loads(scans), nscopes)
                for fid, url, scans, nscopes in self._Query(
                    'SELECT id, url, scans, nscopes FROM files')}

    def ReadData(self, fid: int) -> tuple[Any, list[int]]:
        """The unpacked ``data`` of one file (None when there is none) and the ids of
        the files it depends on."""
        rows = self._Query('SELECT data, deps FROM contents WHERE id = ?', (fid,))
        if not rows:
            return None, []
        data, deps = rows[0]
        return (Unpack(data) if data is not None else None,
                [int(d) for d in deps.split(',')] if deps else [])

    def ReadImports(self, fids: list[int]) -> dict[int, list]:
        """id -> list of [scope name, import equivalent] for the files asked."""
        result: dict[int, list] = {}
        for start in range(0, len(fids), 500):
            chunk = fids[start:start + 500]
            marks = ','.join('?' * len(chunk))
            for fid, imports in self._Query(
                    f'SELECT id, imports FROM contents WHERE id IN ({marks})', chunk):
                result[fid] = Unpack(imports) if imports is not None else []
        return result

    def ReadAllDeps(self) -> list[tuple[int, list[int]]]:
        """(id, ids of the files its derived information used) for every file."""
        return [(fid, [int(d) for d in deps.split(',')])
                for fid, deps in self._Query(
                    "SELECT id, deps FROM contents WHERE deps IS NOT NULL AND deps != ''")]

    def Stats(self) -> dict[str, int]:
        """Files and scopes stored, and the file's size in bytes."""
        files, scopes = self._Query('SELECT COUNT(*), COALESCE(SUM(nscopes), 0) FROM files'
                                    ' WHERE nscopes > 0 OR scans != ?', ('{}',))[0]
        size = os.path.getsize(self.fPath) if os.path.exists(self.fPath) else 0
        return {'files': files, 'scopes': scopes, 'bytes': size}

    # -- writing -------------------------------------------------------------------

    def Write(self, new_urls: list[str], rows: Iterable[tuple], deleted: list[int],
              known_ids: dict[str, int]) -> None:
        """One transaction: add ``new_urls`` to ``files`` (their ids are stored in
        ``known_ids``), then write ``rows`` of (url, scans JSON, nscopes, imports,
        data, URLs of the files it depends on or None) and delete the files of ids
        ``deleted``.  Nothing of it stays when any statement fails."""
        conn = self._Conn()
        added: list[str] = []
        try:
            conn.execute('BEGIN IMMEDIATE')
            for url in new_urls:
                cur = conn.execute("INSERT INTO files (url, scans, nscopes) VALUES (?, '{}', 0)",
                                   (UrlToBlob(url),))
                known_ids[url] = cur.lastrowid
                added.append(url)
            for url, scans, nscopes, imports, data, deps in rows:
                fid = known_ids[url]
                if deps is not None:
                    deps = ','.join(str(known_ids[d]) for d in deps)
                conn.execute('UPDATE files SET scans = ?, nscopes = ? WHERE id = ?',
                             (scans, nscopes, fid))
                conn.execute('INSERT OR REPLACE INTO contents VALUES (?, ?, ?, ?)',
                             (fid, imports, data, deps))
            for fid in deleted:
                conn.execute('DELETE FROM files WHERE id = ?', (fid,))
                conn.execute('DELETE FROM contents WHERE id = ?', (fid,))
            conn.execute('COMMIT')
        except BaseException as exc:
            for url in added:
                known_ids.pop(url, None)
            if conn.in_transaction:
                try:
                    conn.execute('ROLLBACK')
                except sqlite3.Error:
                    pass
            if isinstance(exc, (sqlite3.Error, OSError)):
                raise CDatabaseError(_Describe(exc, self.fPath)) from None
            raise
