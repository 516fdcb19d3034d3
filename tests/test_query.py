"""./run query: one scope through the editor's immediate-scan path, end to end."""
import os
import re
import subprocess
import sys

import pytest

ROOT = os.path.dirname(os.path.dirname(os.path.abspath(__file__)))
EXT = os.environ.get('PYSOURCE_EXT_DIR', os.path.join(ROOT, 'build', 'ext'))
ENV = dict(os.environ, PYTHONPATH=os.pathsep.join([os.path.join(ROOT, 'standin'), EXT]),
           COLUMNS='200')

SHAPES = '''\
import helper
from helper import make

LIMIT = 10


class Shape:
    sides = [1, 2]

    def __init__(self, w, h=3):
        self.w = make(w)
        self.label = "x"

    def area(self):
        return self.w


def build():
    return Shape(1)
'''


@pytest.fixture
def project(tmp_path):
    (tmp_path / 'shapes.py').write_text(SHAPES)
    (tmp_path / 'helper.py').write_text('def make(s):\n    return s\n')
    return tmp_path


def query(project, *args):
    proc = subprocess.run([sys.executable, os.path.join(ROOT, 'tools', 'query.py'),
                           str(project / 'shapes.py'), *args, '--no-follow-stdlib',
                           '--db', str(project / 'db.sqlite')],
                          env=ENV, capture_output=True, text=True, timeout=120, check=False)
    assert 'Traceback' not in proc.stdout + proc.stderr
    return proc.returncode, proc.stdout, proc.stderr


def rows(out):
    """name -> (kind, resolves to) of the printed tables (the last one wins)."""
    found = {}
    for line in out.splitlines():
        cells = re.split(r'\s{2,}', line.strip())
        if len(cells) == 3 and cells[0] != 'name':
            found[cells[0]] = (cells[1], cells[2])
    return found


def test_a_scope_within_the_deadline(project):
    status, out, _err = query(project, '', '--visible', str(project / 'helper.py'))
    assert status == 0
    assert ('opened shapes.py as the active document: scan moved from priority 2 (background) '
            'to 1 (interactive)') in out
    assert 'opened helper.py as a visible document: scan moved from priority 2' in out
    assert 'deadline passed' not in out
    assert rows(out) == {
        'helper': ('import', 'module helper.py'),
        # Only the scope asked for is scanned now; helper.py is left to the idle loop.
        'make': ('from-import', 'unresolved helper.make'),
        'LIMIT': ('literal', 'instance int'),
        'Shape': ('class', 'class shapes.py#Shape'),
        'build': ('function', 'function shapes.py#build'),
    }


def test_an_instance_scope_goes_through_the_instance_path(project):
    status, out, _err = query(project, 'Shape()')
    assert status == 0 and "TryToScanNow('Shape()')" in out
    assert rows(out) == {
        'sides': ('literal', 'instance list'),
        '__init__': ('bound method', 'method shapes.py#Shape.__init__'),
        'area': ('bound method', 'method shapes.py#Shape.area'),
        'w': ('expression', 'result of make'),
        'label': ('literal', 'instance str'),
    }


@pytest.mark.parametrize('scope, name, expected', [
    ('', 'make', ('from-import', 'function helper.py#make')),
    ('Shape()', 'w', ('expression', 'result of make')),
])
def test_past_the_deadline_the_idle_loop_finishes(project, scope, name, expected):
    status, out, _err = query(project, scope, '--deadline-ms', '0')
    assert status == 0
    before, _sep, after = out.partition('the idle loop finished the rest')
    assert 'the deadline passed' in before and 'nothing known yet about' in before
    assert rows(after)[name] == expected


@pytest.mark.parametrize('args, status, message', [
    (['Nope'], 1, 'no scope Nope in shapes.py'),
    (['', '--visible', 'missing.py'], 2, 'query: no such file: missing.py'),
])
def test_a_missing_scope_or_file(project, args, status, message):
    got, out, err = query(project, *args)
    assert got == status and message in out + err
