"""Scope names and the equivalence format of symbol information.

Scope names
-----------
A scope name is the dotted path of class and def names from the module down:
``''`` is the module's top-level scope, ``'C'`` a class, ``'C.meth'`` a method,
``'f.inner'`` a function nested in a function.  Two suffixes may end a leaf:

- ``#N`` (N >= 2): the N-th definition of the same name in the same scope
  (``def f`` twice in a module gives ``'f'`` and ``'f#2'``);
- ``()``: the instance scope of a class: ``'C()'`` describes instances of ``C``.

``'*'`` (``kWildcardScope``) stands for every scope of a file (a whole-file scan).

Equivalents
-----------
Each name of a scope maps to a bytes value holding one or more *equivalents*
joined by ``;``.  An equivalent starts with a two-byte prefix ``:`` + kind
(``kPrefixLen`` == 2); one without a leading colon is a *plain* equivalent (kind
``kPlainEquivKind``): the source text of an expression.  Kinds:

=========  ======================================================================
``:i``     import: the body is a dotted module name (``:ios.path``)
``:f``     from-import: module, one space, imported name (``:fos path``,
           ``:f.. sibling``, ``:fpkg *``); a module ending in ``.`` is relative
``:c``     a class defined here, with its packed definition info
``:d``     a function defined here (module or function scope), definition info
``:u``     an unbound method: a def in a class scope, definition info
``:m``     a bound method: a def seen through an instance scope, definition info
``:a``     a parameter of the scope's function; body = position, optional ``=``
           and the default's source text
``:l``     a literal; body = the literal's type name (``:lint``)
=========  ======================================================================

Packed definition info (``PackDefInfoStr``/``UnpackDefInfoStr``): prefix, then
``scope_name|lineno|end_lineno|arg1,arg2,...`` (bytes, UTF-8).

Plain equivalents may contain ``;`` inside brackets or string literals; ``NonNestedSplit``
splits only at nesting level 0 and outside quotes.
"""
from __future__ import annotations

from collections.abc import Iterable
from typing import NamedTuple

kWildcardScope = '*'
kModuleScope = ''
kInstanceSuffix = '()'
kRedefinitionMark = '#'

kPrefixLen = 2
kEquivSeparator = b';'

kPlainEquivKind = b'p'
kImportKind = b'i'
kFromImportKind = b'f'
kClassKind = b'c'
kFunctionKind = b'd'
kUnboundMethodKind = b'u'
kMethodKind = b'm'
kParamKind = b'a'
kLiteralKind = b'l'

kImportPrefix = b':' + kImportKind
kFromImportPrefix = b':' + kFromImportKind
kClassPrefix = b':' + kClassKind
kFunctionPrefix = b':' + kFunctionKind
kUnboundMethodPrefix = b':' + kUnboundMethodKind
kMethodPrefix = b':' + kMethodKind
kParamPrefix = b':' + kParamKind
kLiteralPrefix = b':' + kLiteralKind

kDefPrefixes = (kClassPrefix, kFunctionPrefix, kUnboundMethodPrefix, kMethodPrefix)

# -- scope names ---------------------------------------------------------------


def IsInstanceScope(name: str) -> bool:
    """True for the instance scope of a class (``'C()'``)."""
    return len(name) > len(kInstanceSuffix) and name.endswith(kInstanceSuffix)


def GetInstanceNameForClass(name: str) -> str:
    return name + kInstanceSuffix


def GetClassForInstanceName(name: str) -> str:
    if not IsInstanceScope(name):
        raise ValueError(f'not an instance scope name: {name!r}')
    return name[:-len(kInstanceSuffix)]


def ParentScopeName(name: str) -> str:
    """The enclosing scope (``''`` for a top-level name).  Always shorter than ``name``
    unless ``name`` is already ``''``."""
    return name.rpartition('.')[0]


def LeafScopeName(name: str) -> str:
    return name.rpartition('.')[2]


def ParentAndLeafScopeNames(name: str) -> tuple[str, str]:
    parent, _sep, leaf = name.rpartition('.')
    return parent, leaf


def JoinScopeName(parent: str, leaf: str) -> str:
    return f'{parent}.{leaf}' if parent else leaf


def SplitScopeNameFromSuffixes(name: str) -> tuple[str, str, str]:
    """(name without suffixes, redefinition suffix or '', instance suffix or '')."""
    inst = ''
    if IsInstanceScope(name):
        name, inst = name[:-len(kInstanceSuffix)], kInstanceSuffix
    prefix, _sep, leaf = name.rpartition('.')
    base, mark, num = leaf.partition(kRedefinitionMark)
    if mark and num.isdigit():
        redef = mark + num
        return (JoinScopeName(prefix, base) if prefix else base), redef, inst
    return name, '', inst


def AddRedefinitionSuffix(name: str, count: int) -> str:
    """The name of the ``count``-th definition of ``name`` (count 1: the name itself)."""
    return name if count <= 1 else f'{name}{kRedefinitionMark}{count}'


def IsTopLevelModuleScope(name: str) -> bool:
    return name == kModuleScope


# -- equivalents ---------------------------------------------------------------

_kOpen = {ord('('): ord(')'), ord('['): ord(']'), ord('{'): ord('}')}
_kClose = {v for v in _kOpen.values()}
_kQuotes = (ord('"'), ord("'"))


def NonNestedSplit(text: str | bytes, sep: str | bytes) -> list:
    """Split ``text`` at ``sep`` (one character) outside brackets and string literals.

    Works on str and bytes (``sep`` may be either); the parts have ``text``'s type.
    An empty text gives no parts.
    """
    if not text:
        return []
    is_bytes = isinstance(text, (bytes, bytearray))
    if is_bytes:
        sep_b = sep.encode() if isinstance(sep, str) else bytes(sep)
        codes = text
    else:
        sep_b = sep.encode() if isinstance(sep, str) else bytes(sep)
        codes = None
    if len(sep_b) != 1:
        raise ValueError('separator must be one character')
    if (sep_b if is_bytes else sep_b.decode('latin-1')) not in text:
        return [text[:]]  # the common case: one part
    sep_code = sep_b[0]
    parts = []
    depth = 0
    quote = 0
    escaped = False
    start = 0
    n = len(text)
    for i in range(n):
        c = codes[i] if is_bytes else ord(text[i])
        if quote:
            if escaped:
                escaped = False
            elif c == 92:  # backslash
                escaped = True
            elif c == quote:
                quote = 0
            continue
        if c in _kQuotes:
            quote = c
        elif c in _kOpen:
            depth += 1
        elif c in _kClose:
            depth = max(0, depth - 1)
        elif c == sep_code and depth == 0:
            parts.append(text[start:i])
            start = i + 1
    parts.append(text[start:n])
    return parts


def JoinEquivs(equivs: Iterable[bytes]) -> bytes:
    """Join equivalents into one value, dropping repeats (first occurrence kept)."""
    seen: list[bytes] = []
    for eq in equivs:
        for part in NonNestedSplit(eq, kEquivSeparator):
            if part and part not in seen:
                seen.append(part)
    return kEquivSeparator.join(seen)


def EquivKind(eq: bytes) -> bytes:
    """The kind byte of one equivalent (``kPlainEquivKind`` without a prefix)."""
    if len(eq) >= kPrefixLen and eq[:1] == b':':
        return eq[1:2]
    return kPlainEquivKind[:1]


def InfoContains(infos: bytes, prefix: bytes | tuple[bytes, ...]) -> bool:
    """Whether some equivalent of ``infos`` starts with ``prefix`` (or one of them)."""
    if not infos:
        return False
    return any(part.startswith(prefix) for part in NonNestedSplit(infos, kEquivSeparator))


def AllDotsInSlice(text: str, start: int, end: int) -> bool:
    """Whether ``text[start:end]`` consists of dots only (True when empty)."""
    return all(ch == '.' for ch in text[start:end])


def MakeImportEquiv(module: str) -> bytes:
    return kImportPrefix + module.encode('utf-8')


def MakeFromImportEquiv(module: str, name: str) -> bytes:
    return kFromImportPrefix + f'{module} {name}'.encode()


def MakeLiteralEquiv(type_name: str) -> bytes:
    return kLiteralPrefix + type_name.encode('utf-8')


def MakeParamEquiv(index: int, default_text: str | None = None) -> bytes:
    body = str(index) if default_text is None else f'{index}={default_text}'
    return kParamPrefix + body.encode('utf-8', 'surrogateescape')


def MakePlainEquiv(source_text: str) -> bytes:
    """A plain equivalent: the expression's text, made safe to stand without a prefix."""
    text = ' '.join(source_text.split())
    if text.startswith(':'):
        text = ' ' + text
    return text.encode('utf-8', 'surrogateescape')


class CDefInfo(NamedTuple):
    """Unpacked definition info of a class, function or method."""

    prefix: bytes
    scope_name: str
    lineno: int
    end_lineno: int
    args: tuple[str, ...]


def PackDefInfoStr(prefix: bytes, scope_name: str, lineno: int, end_lineno: int,
                   args: Iterable[str] = ()) -> bytes:
    if prefix not in kDefPrefixes:
        raise ValueError(f'not a definition prefix: {prefix!r}')
    body = f'{scope_name}|{lineno}|{end_lineno}|{",".join(args)}'
    return prefix + body.encode('utf-8')


def UnpackDefInfoStr(packed: bytes) -> CDefInfo:
    """The ``CDefInfo`` of one packed definition equivalent (bytes only)."""
    if not isinstance(packed, bytes):
        raise TypeError(f'definition info must be bytes, not {type(packed).__name__}')
    prefix = packed[:kPrefixLen]
    if prefix not in kDefPrefixes:
        raise ValueError(f'not a definition equivalent: {packed!r}')
    fields = packed[kPrefixLen:].decode('utf-8').split('|')
    if len(fields) != 4:
        raise ValueError(f'malformed definition info: {packed!r}')
    scope_name, lineno, end_lineno, args = fields
    return CDefInfo(prefix, scope_name, int(lineno), int(end_lineno),
                    tuple(a for a in args.split(',') if a))


def FindDefInfo(infos: bytes, prefixes: bytes | tuple[bytes, ...]) -> CDefInfo | None:
    """The first definition equivalent of ``infos`` with one of ``prefixes``, unpacked."""
    if not InfoContains(infos, prefixes):
        return None
    for part in NonNestedSplit(infos, kEquivSeparator):
        if part.startswith(prefixes):
            return UnpackDefInfoStr(part)
    return None
