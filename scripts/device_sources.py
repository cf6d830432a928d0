#!/usr/bin/env python3
"""Prints the C++ sources that Android.bp compiles into a device binary, one path a line.

The binary's own srcs and those of every library module of the same file that it links
(static_libs and whole_static_libs, followed through the libraries they name themselves), with
the modules' defaults and their target.android parts, less their exclude_srcs. Globs are expanded
as Soong does: "*" within one folder, "**" across folders. A host-only source (host/...) is an
error, since nothing under host/ may ever reach a phone.

Usage: device_sources.py [--binary NAME] ANDROID_BP
"""

import argparse
import glob
import json
import os
import re
import sys

TOKEN = re.compile(r'\s+|//[^\n]*|/\*.*?\*/|"(?:[^"\\]|\\.)*"|[A-Za-z_][A-Za-z0-9_]*|-?\d+|[{}\[\]:,=+]', re.S)
SOURCE_SUFFIXES = ('.cpp', '.cc', '.cxx')
LINK_PROPERTIES = ('static_libs', 'whole_static_libs')


class BlueprintError(Exception):
    pass


def tokenize(text):
    tokens, pos = [], 0
    while pos < len(text):
        match = TOKEN.match(text, pos)
        if match is None:
            line = text.count('\n', 0, pos) + 1
            raise BlueprintError(f'line {line}: unexpected {text[pos:pos + 20]!r}')
        token = match.group(0)
        if not (token.isspace() or token.startswith('//') or token.startswith('/*')):
            tokens.append(token)
        pos = match.end()
    return tokens


class Parser:
    """Blueprint's grammar: variables, modules, and values (strings, numbers, booleans, lists,
    maps, variable references, "+" concatenation)."""

    def __init__(self, text):
        self.tokens = tokenize(text)
        self.pos = 0
        self.variables = {}

    def peek(self):
        return self.tokens[self.pos] if self.pos < len(self.tokens) else None

    def take(self, expected=None):
        token = self.peek()
        if token is None or (expected is not None and token != expected):
            raise BlueprintError(f'expected {expected or "more"}, found {token!r}')
        self.pos += 1
        return token

    def modules(self):
        found = []
        while self.peek() is not None:
            name = self.take()
            if self.peek() in ('=', '+'):
                operator = self.take()
                if operator == '+':
                    self.take('=')
                value = self.value()
                self.variables[name] = self.variables[name] + value if operator == '+' else value
            else:
                found.append((name, self.map()))
        return found

    def map(self):
        result = {}
        self.take('{')
        while self.peek() != '}':
            key = self.take()
            self.take(':')
            result[key] = self.value()
            if self.peek() != '}':
                self.take(',')
        self.take('}')
        return result

    def value(self):
        result = self.operand()
        while self.peek() == '+':
            self.take()
            result = result + self.operand()
        return result

    def operand(self):
        token = self.peek()
        if token == '{':
            return self.map()
        if token == '[':
            self.take()
            items = []
            while self.peek() != ']':
                items.append(self.value())
                if self.peek() != ']':
                    self.take(',')
            self.take(']')
            return items
        self.take()
        if token.startswith('"'):
            return json.loads(token)
        if token in ('true', 'false'):
            return token == 'true'
        if re.fullmatch(r'-?\d+', token):
            return int(token)
        if token in self.variables:
            return self.variables[token]
        raise BlueprintError(f'unknown value {token!r}')


def property_list(module, defaults, key):
    """The module's list for key, with its defaults' and its target.android part's."""
    values = []
    for name in module.get('defaults', []):
        values += property_list(defaults.get(name, {}), defaults, key)
    values += module.get(key, [])
    values += module.get('target', {}).get('android', {}).get(key, [])
    return values


def expand(root, patterns):
    paths = set()
    for pattern in patterns:
        matches = glob.glob(os.path.join(root, pattern), recursive=True)
        if not matches and not glob.has_magic(pattern):
            raise BlueprintError(f'source {pattern} does not exist')
        paths.update(os.path.relpath(path, root) for path in matches if os.path.isfile(path))
    return paths


def device_sources(bp_path, binary):
    root = os.path.dirname(os.path.abspath(bp_path))
    with open(bp_path, encoding='utf-8') as bp:
        modules = Parser(bp.read()).modules()
    by_name = {props.get('name'): (kind, props) for kind, props in modules}
    defaults = {name: props for name, (kind, props) in by_name.items() if kind == 'cc_defaults'}
    if by_name.get(binary, ('',))[0] != 'cc_binary':
        raise BlueprintError(f'no cc_binary named {binary}')

    sources, pending, seen = set(), [binary], set()
    while pending:
        name = pending.pop()
        if name in seen or name not in by_name:
            continue  # libraries of the platform itself (libminizip...) are not ours to check
        seen.add(name)
        module = by_name[name][1]
        sources |= expand(root, property_list(module, defaults, 'srcs')) - \
            expand(root, property_list(module, defaults, 'exclude_srcs'))
        for key in LINK_PROPERTIES:
            pending += property_list(module, defaults, key)

    host_only = sorted(path for path in sources if path.split(os.sep)[0] == 'host')
    if host_only:
        raise BlueprintError('host-only sources in the device build: ' + ' '.join(host_only))
    other = sorted(path for path in sources if not path.endswith(SOURCE_SUFFIXES))
    if other:
        raise BlueprintError('sources this check cannot compile: ' + ' '.join(other))
    return sorted(sources)


def main():
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument('--binary', default='orvane')
    parser.add_argument('android_bp')
    args = parser.parse_args()
    try:
        sources = device_sources(args.android_bp, args.binary)
    except (BlueprintError, OSError) as error:
        print(f'device_sources.py: {args.android_bp}: {error}', file=sys.stderr)
        return 1
    print('\n'.join(sources))
    return 0


if __name__ == '__main__':
    sys.exit(main())
