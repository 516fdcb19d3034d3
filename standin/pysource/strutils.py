"""String helpers of the analysis engine."""
from __future__ import annotations


def NormalizeEOLs(text: str) -> str:
    """``text`` with every line ending (\\r\\n, \\r) turned into \\n."""
    return text.replace('\r\n', '\n').replace('\r', '\n')


def DecodeSource(data: bytes, strict: bool = False) -> str:
    """Decode Python source bytes: a BOM or coding cookie, else UTF-8.

    Lenient by default (undecodable bytes become U+FFFD); with ``strict`` a bad
    cookie raises SyntaxError or LookupError and bad bytes UnicodeDecodeError,
    as they make the file unimportable.
    """
    import io
    import tokenize
    try:
        encoding, _lines = tokenize.detect_encoding(io.BytesIO(data).readline)
    except SyntaxError:
        if strict:
            raise
        encoding = 'utf-8'
    try:
        text = data.decode(encoding)
    except (LookupError, UnicodeDecodeError):
        if strict:
            raise
        return data.decode('utf-8', 'replace')
    return text


def DescribeDecodeError(exc: BaseException) -> str:
    """A one-line reason for a ``DecodeSource(strict=True)`` failure."""
    if isinstance(exc, UnicodeDecodeError):
        return f'invalid {exc.encoding} byte 0x{exc.object[exc.start]:02x} at offset {exc.start}'
    if isinstance(exc, LookupError):
        return f'unknown encoding ({exc})'
    return str(exc)


def StrInStr(needle: str, haystack: str) -> bool:
    return needle in haystack


def LeadingWhitespace(line: str) -> str:
    return line[:len(line) - len(line.lstrip(' \t'))]


def Truncate(text: str, limit: int, marker: str = '...') -> str:
    """``text`` cut to at most ``limit`` characters, ending in ``marker`` when cut."""
    if len(text) <= limit:
        return text
    return text[:max(0, limit - len(marker))] + marker
