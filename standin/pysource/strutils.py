"""String helpers of the analysis engine."""
from __future__ import annotations


def NormalizeEOLs(text: str) -> str:
    """``text`` with every line ending (\\r\\n, \\r) turned into \\n."""
    return text.replace('\r\n', '\n').replace('\r', '\n')


def DecodeSource(data: bytes) -> str:
    """Decode Python source bytes: a BOM or coding cookie, else UTF-8 (lenient)."""
    import io
    import tokenize
    try:
        encoding, _lines = tokenize.detect_encoding(io.BytesIO(data).readline)
    except SyntaxError:
        encoding = 'utf-8'
    try:
        return data.decode(encoding)
    except (LookupError, UnicodeDecodeError):
        return data.decode('utf-8', 'replace')


def StrInStr(needle: str, haystack: str) -> bool:
    return needle in haystack


def LeadingWhitespace(line: str) -> str:
    return line[:len(line) - len(line.lstrip(' \t'))]


def Truncate(text: str, limit: int, marker: str = '...') -> str:
    """``text`` cut to at most ``limit`` characters, ending in ``marker`` when cut."""
    if len(text) <= limit:
        return text
    return text[:max(0, limit - len(marker))] + marker
