"""Derivation of what names resolve to, from the primary information of scopes.

``CInferencer.DeriveScope(info)`` maps each name of a scope to a short
description of what it resolves to:

- ``module <url>`` (or ``module? <name>`` when the module has no file found),
- ``class <url>#<scope>``, ``function <url>#<scope>``, ``method <url>#<scope>``,
- ``instance <type>`` for literals and for calls of a class, ``parameter``,
- ``unresolved <text>`` when the trail ends.

Names are followed through the scope chain (enclosing functions, the module, then
the builtins module) and through imports into other modules, up to
``kMaxDepth`` steps.  Every module looked into is returned as a dependency, so the
information cache can report the scope stale when that module changes.
"""
from __future__ import annotations

import ast
from typing import Any

from pysource import symbolinfo

kMaxDepth = 8


class CInferencer:
    def __init__(self, ana_mgr: Any) -> None:
        self.fAnaMgr = ana_mgr
        self.fInfoCache = ana_mgr.fInfoCache
        self.fFactory = ana_mgr.fAnalysisFactory

    def DeriveScope(self, info: Any) -> tuple[dict[str, str], set[Any]]:
        """(name -> description, modules used) for one scope's information."""
        deps: set[Any] = set()
        loc, scope_name = info.key.loc, info.key.scope_name
        derived = {}
        for name, value in info.type_equivs.items():
            derived[name] = self.DescribeValue(loc, scope_name, value, 0, deps)
        deps.discard(loc)
        return derived, deps

    def DescribeValue(self, loc: Any, scope_name: str, value: bytes, depth: int,
                      deps: set[Any]) -> str:
        results: list[str] = []
        for eq in symbolinfo.NonNestedSplit(value, symbolinfo.kEquivSeparator):
            desc = self.DescribeEquiv(loc, scope_name, eq, depth, deps)
            if desc not in results:
                results.append(desc)
        return ' | '.join(results) if results else 'unresolved'

    def DescribeEquiv(self, loc: Any, scope_name: str, eq: bytes, depth: int,
                      deps: set[Any]) -> str:
        if depth > kMaxDepth:
            return 'unresolved (too deep)'
        kind = symbolinfo.EquivKind(eq)
        body = eq[symbolinfo.kPrefixLen:].decode('utf-8', 'replace')
        if kind == symbolinfo.kImportKind:
            mod_loc = self.FindModule(body, loc)
            if mod_loc is None:
                return f'module? {body}'
            deps.add(mod_loc)
            return f'module {mod_loc.fUrl}'
        if kind == symbolinfo.kFromImportKind:
            module, _sep, name = body.partition(' ')
            return self._DescribeFromImport(loc, module, name, depth, deps)
        if kind in (symbolinfo.kClassKind, symbolinfo.kFunctionKind,
                    symbolinfo.kUnboundMethodKind, symbolinfo.kMethodKind):
            definfo = symbolinfo.UnpackDefInfoStr(eq)
            word = {symbolinfo.kClassKind: 'class', symbolinfo.kFunctionKind: 'function'}.get(
                kind, 'method')
            return f'{word} {loc.fUrl}#{definfo.scope_name}'
        if kind == symbolinfo.kLiteralKind:
            return f'instance {body}'
        if kind == symbolinfo.kParamKind:
            return 'parameter'
        return self._DescribeExpression(loc, scope_name, eq.decode('utf-8', 'replace'),
                                        depth, deps)

    def _DescribeFromImport(self, loc: Any, module: str, name: str, depth: int,
                            deps: set[Any]) -> str:
        mod_loc = self.FindModule(module, loc)
        if mod_loc is not None:
            deps.add(mod_loc)
            if name == '*':
                return f'module {mod_loc.fUrl}'
            top = self.fInfoCache.GetScopeInfo(mod_loc, symbolinfo.kModuleScope)
            if top is not None and name in top.type_equivs:
                return self.DescribeValue(mod_loc, symbolinfo.kModuleScope,
                                          top.type_equivs[name], depth + 1, deps)
        elif name == '*':
            return f'module? {module}'
        # Not a name defined by the module: perhaps a submodule of the package.
        joined = module + name if module.endswith('.') else f'{module}.{name}'
        sub = self.FindModule(joined, loc)
        if sub is not None:
            deps.add(sub)
            return f'module {sub.fUrl}'
        return f'unresolved {joined}'

    def _DescribeExpression(self, loc: Any, scope_name: str, text: str, depth: int,
                            deps: set[Any]) -> str:
        try:
            node = ast.parse(text.strip(), mode='eval').body
        except (SyntaxError, ValueError):
            return f'unresolved {text}'
        if isinstance(node, ast.Name):
            return self.ResolveName(loc, scope_name, node.id, depth + 1, deps)
        if isinstance(node, ast.Call):
            callee = ast.unparse(node.func)
            desc = self._DescribeExpression(loc, scope_name, callee, depth + 1, deps)
            if desc.startswith('class '):
                return 'instance ' + desc[len('class '):]
            return f'result of {callee}'
        if isinstance(node, ast.Attribute):
            base = self._DescribeExpression(loc, scope_name, ast.unparse(node.value),
                                            depth + 1, deps)
            if base.startswith('module ') and not base.startswith('module? '):
                from ostrelbase import location
                mod_loc = location.CreateFromName(base[len('module '):])
                top = self.fInfoCache.GetScopeInfo(mod_loc, symbolinfo.kModuleScope)
                if top is not None and node.attr in top.type_equivs:
                    return self.DescribeValue(mod_loc, symbolinfo.kModuleScope,
                                              top.type_equivs[node.attr], depth + 1, deps)
            return f'unresolved {text}'
        return f'unresolved {text}'

    def ResolveName(self, loc: Any, scope_name: str, name: str, depth: int,
                    deps: set[Any]) -> str:
        """What ``name`` used in ``scope_name`` of ``loc`` resolves to."""
        scope = scope_name
        while True:
            info = self.fInfoCache.GetScopeInfo(loc, scope)
            if info is not None and name in info.type_equivs:
                return self.DescribeValue(loc, scope, info.type_equivs[name], depth, deps)
            if scope == symbolinfo.kModuleScope:
                break
            scope = symbolinfo.ParentScopeName(scope)
        builtin_loc = self.fInfoCache.fLocCache.GetBuiltinLoc()
        if builtin_loc is not None and builtin_loc != loc:
            top = self.fInfoCache.GetScopeInfo(builtin_loc, symbolinfo.kModuleScope)
            if top is not None and name in top.type_equivs:
                return self.DescribeValue(builtin_loc, symbolinfo.kModuleScope,
                                          top.type_equivs[name], depth, deps)
        return f'unresolved {name}'

    def FindModule(self, name: str, from_loc: Any) -> Any:
        """The file of module ``name`` imported from the file ``from_loc``."""
        if not name:
            return None
        found = self.fFactory.FindModuleLoc(name, from_loc.GetParentDir())
        return found
