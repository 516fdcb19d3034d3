"""The file attribute manager: probable mime types of files."""
from __future__ import annotations

import mimetypes
from typing import Any

from ostrelbase import mime

kExtensionMimeTypes = {
    '.py': mime.kPythonMimeType,
    '.pyw': mime.kPythonMimeType,
    '.pyi': mime.kPythonMimeType,
    '.pi': mime.kPythonMimeType,
    '.pyx': mime.kCythonMimeType,
    '.txt': mime.kPlainTextMimeType,
}


class CFileAttributeManager:
    def GetProbableMimeType(self, loc: Any) -> str | None:
        """The mime type suggested by the file name (None when unknown).  A file
        without an extension counts as Python when its ``#!`` line names python."""
        base = loc.GetBaseName()
        stem, dot, ext = base.rpartition('.')
        if dot and stem:
            ext = '.' + ext.lower()
            found = kExtensionMimeTypes.get(ext)
            if found is not None:
                return found
            return mimetypes.guess_type(base, strict=False)[0]
        from pysource import utils
        return mime.kPythonMimeType if utils.IsPythonSource(loc) else None

    def GetMultipleProbableMimeTypes(self, loc_dict: dict[Any, Any]) -> None:
        """Fill the values of ``loc_dict`` (location -> anything) in place."""
        for loc in list(loc_dict):
            loc_dict[loc] = self.GetProbableMimeType(loc)
