"""Logical lines of Python source: the definition types and line joining.

A logical line is one or more physical lines joined by open brackets or
backslash continuations.  The analysis records, for each scope, the type of the
definition that opens it (``kClassDef`` or ``kFunctionDef``; the module scope has
none).
"""
from __future__ import annotations

import io
import tokenize

kClassDef = 'class'
kFunctionDef = 'def'
kModuleDef = 'module'


def SplitLogicalLines(text: str) -> list[tuple[int, int]]:
    """(first, last) physical line numbers (1-based) of each logical line of ``text``.

    Comment-only and blank lines are not logical lines.  Tokenizer errors end the
    split at the error; what was found before is returned.
    """
    result: list[tuple[int, int]] = []
    start = None
    try:
        for tok in tokenize.generate_tokens(io.StringIO(text).readline):
            if tok.type in (tokenize.COMMENT, tokenize.NL, tokenize.INDENT,
                            tokenize.DEDENT, tokenize.ENCODING):
                continue
            if tok.type == tokenize.NEWLINE:
                if start is not None:
                    result.append((start, tok.start[0]))
                start = None
            elif tok.type == tokenize.ENDMARKER:
                break
            elif start is None:
                start = tok.start[0]
    except (tokenize.TokenError, SyntaxError):
        pass
    return result


def LogicalLineContaining(text: str, lineno: int) -> tuple[int, int] | None:
    """The (first, last) line numbers of the logical line holding physical ``lineno``."""
    for first, last in SplitLogicalLines(text):
        if first <= lineno <= last:
            return first, last
    return None
