"""CScanCoordinator: modification times and the imports found by scans.

Covers turning import equivalents (bytes or text) into module names, the
modification-time filter and the priority comparison that decide which module
files are queued, collecting modification times from buffers and the disk,
and the asynchronous collection that waits for remote locations.

Tests that take `scoord` run on the class and on ScanCountingCoordinator; on
the latter they also check the calls of the coordinator's own operations.
"""
import pytest
from coord_doubles import *
from coord_doubles import (
    PRIMARY,
    Boom,
    local,
    queued,
    record_signals,
    remote,
    waiting,
)
from ostrelbase import location
from scan_doubles import *
from scan_doubles import HashSpyLocation, is_counting

from pysource import symbolinfo

DIR = local('pkg')
L1, L2, L3, L4, L5 = (local(f'lib/m{i}.py') for i in range(1, 6))


def add_imports(coord, equivs, dirloc=DIR, priority=2):
    return coord._CScanCoordinator__AddImportEquivsToQueue(equivs, dirloc, priority)


def looked_up(host):
    """The name sets handed to the factory, in order."""
    return [names for names, _dirloc, _flag in
            host.fLog.args('factory', '_FindPrimaryLocsForNames')]


# ---- from equivalents to module names ----------------------------------------------------

# Each case: equivalents as text, and the module names they stand for.
kExpansions = [
    ([':ios.path'], {'os.path'}),
    ([':fpkg.sub name'], {'pkg.sub.name', 'pkg.sub', 'pkg'}),
    ([':fpkg.sub *'], {'pkg.sub'}),
    ([':f.. sibling'], {'..sibling'}),
    ([':f.mod name'], {'.mod.name', '.mod'}),
    ([':f. name'], {'.name'}),
    ([':ios;:fjson loads', ':ire'], {'os', 'json.loads', 'json', 're'}),
    (['os.path;:ios', ':lint', 'x'], {'os'}),
    ([':fpkg', ':ire'], {'re'}),  # a from-import without a space is ignored
    ([':fpkg a b', ':f name', ':fpkg ', ':ire'], {'re'}),
    ([':fpkg', ':f'], set()),
    ([':lint', 'plain', ':a0=None', ''], set()),
    ([], set()),
]


@pytest.mark.parametrize('as_bytes', [True, False], ids=['bytes', 'text'])
@pytest.mark.parametrize('equivs, names', kExpansions)
def test_import_equivalents_name_modules(scoord, shost, equivs, names, as_bytes):
    if as_bytes:
        equivs = [e.encode() for e in equivs]
    assert add_imports(scoord, equivs, priority=1) is None
    if names:
        assert looked_up(shost) == [names]
        [(found, dirloc, flag)] = shost.fLog.args('factory', '_FindPrimaryLocsForNames')
        assert all(type(n) is str for n in found)
        assert dirloc is DIR and flag is False
    else:
        assert shost.fLog.find('factory') == []
        assert shost.fLog.find('info_cache') == []
    assert queued(scoord) == {}
    if is_counting(scoord):  # no module has a file here
        assert scoord.Called('AddPairsToPrimaryQueue') == []


def test_prefixes_come_from_the_symbol_information_module(scoord, shost):
    eq = symbolinfo.kFromImportPrefix + b'pkg name;' + symbolinfo.kImportPrefix + b'os'
    add_imports(scoord, [eq])
    assert looked_up(shost) == [{'pkg.name', 'pkg', 'os'}]


def test_found_imports_switched_off(scoord, shost):
    scoord._fAnalyzeFoundImports = False
    add_imports(scoord, [b':ios', ':fjson loads'])
    assert shost.fLog.find('factory') == [] and shost.fLog.find('info_cache') == []
    if is_counting(scoord):
        assert scoord.Called('AddPairsToPrimaryQueue') == []
        assert scoord.Called('__GetModtimeDict') == []


def test_directory_must_be_ready(scoord, shost):
    far = remote('far/x.py')
    scoord.AddPairsToPrimaryQueue([(far, '*')])  # parked: not inspected
    assert waiting(scoord)
    scoord._fAnalyzeFoundImports = False
    with pytest.raises(AssertionError):
        add_imports(scoord, [b':ios'], dirloc=far.GetParentDir())
    shost.fDataCache.fReady.add(far.GetParentDir())
    assert add_imports(scoord, [b':ios'], dirloc=far.GetParentDir()) is None


# ---- which module files are queued -------------------------------------------------------

def test_modtime_filter(scoord, shost):
    mods = {'m1': L1, 'm2': L2, 'm3': L3, 'm4': L4, 'm5': L5, 'nofile': None}
    shost.fFactory.fModuleLocs.update(mods)
    shost.fInfoCache.fMTimes.update({L1: 100.0, L2: 101.0, L3: 100.0})
    shost.fCacheMgr.OpenBuffer(L4, modified=True)
    shost.fCacheMgr.OpenBuffer(L5, modified=True)
    last = scoord._fMTimeAtLastWholeFileCheck
    last.update({L1: 100.0, L2: 100.0, L4: -2, L5: 100.0})  # L3: never checked

    add_imports(scoord, [';'.join(f':i{name}' for name in mods)], priority=2)

    # Unchanged since the last check: L1, and L4 still unsaved.
    assert queued(scoord) == {(L2, '*', PRIMARY): 2, (L3, '*', PRIMARY): 2,
                              (L5, '*', PRIMARY): 2}
    assert [a[0] for a in shost.fLog.args('info_cache', 'GetDiskMTime')] == [L1, L2, L3]
    if is_counting(scoord):
        assert scoord.Called('__GetModtimeDict') == [([L1, L2, L3, L4, L5],)]
        assert scoord.Called('AddPairsToPrimaryQueue') == [
            ([(L2, '*'), (L3, '*'), (L5, '*')], False, 2)]


@pytest.mark.parametrize('priority, passed', [(2, False), (1, False), (0, True)])
def test_files_queued_more_urgently_are_left_alone(scoord, shost, priority, passed):
    shost.fFactory.fModuleLocs.update({'m1': L1, 'm2': L2})
    scoord.AddPairsToPrimaryQueue([(L1, '*')], priority=1)
    scoord.AddPairsToPrimaryQueue([(L1, 'f')], priority=2)  # only the whole file counts
    add_imports(scoord, [b':im1', b':im2'], priority=priority)
    assert queued(scoord)[(L1, '*', PRIMARY)] == (0 if passed else 1)
    assert queued(scoord)[(L2, '*', PRIMARY)] == priority
    if is_counting(scoord):
        pairs = [(L1, '*'), (L2, '*')] if passed else [(L2, '*')]
        assert scoord.Called('AddPairsToPrimaryQueue')[-1] == (pairs, False, priority)


def test_nothing_to_add(scoord, shost):
    shost.fFactory.fModuleLocs.update({'m1': L1, 'm2': L2})
    scoord._fMTimeAtLastWholeFileCheck[L1] = 100.0
    scoord.AddPairsToPrimaryQueue([(L2, '*')], priority=1)
    # L1 is unchanged: nothing passes the filter.
    add_imports(scoord, [b':im1'], priority=2)
    # L2 passes the filter, but is already queued more urgently.
    add_imports(scoord, [b':im2'], priority=2)
    assert queued(scoord) == {(L2, '*', PRIMARY): 1}
    if is_counting(scoord):
        assert scoord.Called('AddPairsToPrimaryQueue') == [
            ([(L2, '*')], True, 1), ([], False, 2)]


def test_unready_remote_files_are_always_passed_on(scoord, shost, monkeypatch):
    far, near = remote('lib/far.py'), remote('lib/near.py')
    shost.fFactory.fModuleLocs.update({'far': far, 'near': near, 'm1': L1})
    scoord.AddPairsToPrimaryQueue([(remote('other/x.py'), '*')])  # some remote file queued
    monkeypatch.setitem(location._gInspections._fStats, near,
                        location.CStatInfo(True, False, 100.0, 10))
    assert near.IsReady() and not far.IsReady()
    scoord._fMTimeAtLastWholeFileCheck.update({near: 100.0, L1: 100.0})

    add_imports(scoord, [b':ifar;:inear;:im1'], priority=2)

    assert [a[0] for a in shost.fLog.args('info_cache', 'GetDiskMTime')] == [L1, near]
    assert (far, '*', PRIMARY, 2) in waiting(scoord)
    assert all(loc not in (near, L1) for loc, _s, _n in queued(scoord))
    if is_counting(scoord):
        assert scoord.Called('__GetModtimeDict') == [([L1, near],)]
        assert scoord.Called('AddPairsToPrimaryQueue')[-1] == ([(far, '*')], False, 2)


def test_errors_of_the_factory_propagate(scoord, shost):
    shost.fFactory.Fail('_FindPrimaryLocsForNames', Boom('no path'))
    with pytest.raises(Boom):
        add_imports(scoord, [b':ios'])
    assert queued(scoord) == {}


# ---- modification times -------------------------------------------------------------------

def test_modtime_dict_from_buffers_and_disk(scoord, shost):
    locs = [L1, L2, L3, L4]
    shost.fCacheMgr.OpenBuffer(L2, modified=True, mtime=7.0)
    shost.fCacheMgr.OpenBuffer(L3, modified=False, mtime=42.5)
    shost.fInfoCache.fMTimes.update({L1: 11.0, L4: 0.0})
    record_signals(scoord, shost.fLog, 'modtimes-updated')

    result = scoord._CScanCoordinator__GetModtimeDict(iter(locs))

    assert result == {L1: 11.0, L2: -2, L3: 42.5, L4: 0.0}
    assert type(result[L2]) is int
    assert list(result) == [L2, L3, L1, L4]  # buffers first, then the disk
    [signal] = shost.fLog.find('signal')
    assert signal.args == (result,) and signal.args[0] is result
    assert [(c.who, c.what, c.args) for c in shost.fLog if c.who != 'signal'] == [
        ('cache_mgr', 'DoesCacheBufferExist', (L1, True)),
        ('cache_mgr', 'DoesCacheBufferExist', (L2, True)),
        ('buffer', 'IsModified', (L2,)),
        ('cache_mgr', 'DoesCacheBufferExist', (L3, True)),
        ('buffer', 'IsModified', (L3,)),
        ('buffer', '_GetLastKnownModTime', (L3,)),
        ('cache_mgr', 'DoesCacheBufferExist', (L4, True)),
        ('info_cache', 'GetDiskMTime', (L1,)),
        ('info_cache', 'GetDiskMTime', (L4,)),
    ]


def test_disk_times_are_all_fetched_before_any_is_stored(scoord, shost):
    a, b, c = (HashSpyLocation(f'/src/{n}.py', shost.fLog) for n in 'abc')
    scoord._CScanCoordinator__GetModtimeDict([a, b, c])
    trace = [(e.who, e.what) for e in shost.fLog if e.who in ('hash', 'info_cache')]
    first_disk = trace.index(('info_cache', 'GetDiskMTime'))
    after = trace[first_disk:]
    assert after[:3] == [('info_cache', 'GetDiskMTime')] * 3
    assert ('hash', 'a.py') in after[3:]


def test_modtime_dict_of_nothing(scoord, shost):
    record_signals(scoord, shost.fLog, 'modtimes-updated')
    assert scoord._CScanCoordinator__GetModtimeDict([]) == {}
    assert [c.args for c in shost.fLog.find('signal')] == [({},)]


def test_modtime_dict_errors_propagate_before_the_signal(scoord, shost):
    record_signals(scoord, shost.fLog, 'modtimes-updated')
    shost.fInfoCache.Fail('GetDiskMTime', Boom('disk gone'))
    with pytest.raises(Boom):
        scoord._CScanCoordinator__GetModtimeDict([L1])
    assert shost.fLog.find('signal') == []


# ---- waiting for remote locations ------------------------------------------------------------

@pytest.mark.parametrize('force', [False, True])
def test_get_modtimes_waits_for_inspection(scoord, shost, monkeypatch, force):
    shost.PatchWaitForInspect(monkeypatch)
    record_signals(scoord, shost.fLog, 'modtimes-updated')
    got = []

    def completed(modtimes):
        got.append(modtimes)
        shost.fLog.add('test', 'completed')

    locs = [L1, L2]
    args = (force,) if force else ()
    assert scoord._CScanCoordinator__GetModtimes(locs, completed, *args) is None
    [(seq, callback, passed_force)] = shost.fWaits
    assert seq is locs and passed_force is force
    assert got == [] and shost.fLog.find('signal') == []

    shost.fLog.add('test', 'inspected')
    callback(False)
    assert got == [{L1: 100.0, L2: 100.0}]
    after = [(c.who, c.what) for c in shost.fLog if c.who in ('test', 'info_cache', 'signal')]
    assert after == [('test', 'inspected'), ('info_cache', 'GetDiskMTime'),
                     ('info_cache', 'GetDiskMTime'), ('signal', 'modtimes-updated'),
                     ('test', 'completed')]
    assert shost.fLog.find('signal')[0].args == (got[0],)


def test_get_modtimes_may_answer_at_once(scoord, shost, monkeypatch):
    shost.PatchWaitForInspect(monkeypatch, answer_now=False)
    record_signals(scoord, shost.fLog, 'modtimes-updated')
    got = []
    scoord._CScanCoordinator__GetModtimes((loc for loc in [L1]), got.append)
    assert got == [{L1: 100.0}]
    assert len(shost.fLog.find('signal')) == 1


def test_get_modtimes_abort(scoord, shost, monkeypatch, capsys):
    shost.PatchWaitForInspect(monkeypatch)
    record_signals(scoord, shost.fLog, 'modtimes-updated')
    got = []
    locs = [remote('lib/far.py'), L1]
    scoord._CScanCoordinator__GetModtimes(locs, got.append)
    shost.fWaits[0][1](True)
    out = capsys.readouterr().out
    assert out == f'Skipping modtime processing due to remote agent abort: {locs}\n'
    assert got == []
    assert shost.fLog.find('signal') == [] and shost.fLog.find('info_cache') == []


def test_get_modtimes_with_the_real_inspection(scoord, shost):
    got = []
    scoord._CScanCoordinator__GetModtimes([L1, L2], got.append)
    assert got == [{L1: 100.0, L2: 100.0}]
