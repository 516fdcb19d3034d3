"""CScanCoordinator: modification times and the imports found by scans.  Import
equivalents (bytes or text) to module names, the modification-time filter and
the priority comparison that decide which module files are queued, times from
buffers and the disk, and the collection that waits for remote locations."""
import pytest
from coord_doubles import *
from ostrelbase import location

from pysource import symbolinfo

DIR = local('pkg')
L1, L2, L3, L4, L5 = (local(f'lib/m{i}.py') for i in range(1, 6))


def add_imports(coord, equivs, dirloc=DIR, priority=2):
    return coord._CScanCoordinator__AddImportEquivsToQueue(equivs, dirloc, priority)


@pytest.mark.parametrize('as_bytes', [True, False])
@pytest.mark.parametrize('equivs, names', [
    ([':ios.path'], {'os.path'}),
    ([':fpkg.sub name'], {'pkg.sub.name', 'pkg.sub', 'pkg'}),
    ([':fpkg.sub *'], {'pkg.sub'}),
    ([':f.. sibling'], {'..sibling'}),
    ([':f.mod name'], {'.mod.name', '.mod'}),
    ([':f. name'], {'.name'}),
    ([':ios;:fjson loads', ':ire'], {'os', 'json.loads', 'json', 're'}),
    (['os.path;:ios', ':lint', 'x'], {'os'}),
    ([':fpkg', ':fpkg a b', ':f name', ':fpkg ', ':ire'], {'re'}),
    ([':lint', 'plain', ':a0=None', '', ':f'], set()),
])
def test_import_equivalents_name_modules(coord, host, equivs, names, as_bytes):
    add_imports(coord, [e.encode() for e in equivs] if as_bytes else equivs, priority=1)
    found = host.fLog.args('factory', '_FindPrimaryLocsForNames')
    assert found == ([(names, DIR, False)] if names else [])
    assert all(type(n) is str for args in found for n in args[0])
    assert queued(coord) == {}  # no module has a file here


def test_imports_are_followed_only_when_asked_and_from_a_ready_directory(coord, host):
    eq = symbolinfo.kFromImportPrefix + b'pkg name;' + symbolinfo.kImportPrefix + b'os'
    add_imports(coord, [eq])
    assert host.fLog.args('factory', '_FindPrimaryLocsForNames')[0][0] == {'pkg.name', 'pkg',
                                                                          'os'}
    host.fLog.clear()
    with pytest.raises(TypeError, match='^Expected str, got int$'):
        add_imports(coord, [b':ios', 5])
    host.fLog.clear()
    coord._fAnalyzeFoundImports = False
    add_imports(coord, [b':ios'])
    assert host.fLog == []
    far = remote('far/x.py')
    coord.AddPairsToPrimaryQueue([(far, '*')])  # parked: its directory is not inspected
    with pytest.raises(AssertionError):
        add_imports(coord, [b':ios'], dirloc=far.GetParentDir())
    host.fDataCache.fReady.add(far.GetParentDir())
    assert add_imports(coord, [b':ios'], dirloc=far.GetParentDir()) is None


def test_the_modtime_filter(coord, host):
    mods = {'m1': L1, 'm2': L2, 'm3': L3, 'm4': L4, 'm5': L5, 'nofile': None}
    host.fFactory.fModuleLocs.update(mods)
    host.fInfoCache.fMTimes.update({L1: 100.0, L2: 101.0, L3: 100.0})
    host.fCacheMgr.OpenBuffer(L4, modified=True)
    host.fCacheMgr.OpenBuffer(L5, modified=True)
    coord._fMTimeAtLastWholeFileCheck.update({L1: 100.0, L2: 100.0, L4: -2, L5: 100.0})
    add_imports(coord, [';'.join(f':i{name}' for name in mods)], priority=2)
    # Unchanged since the last check: L1, and L4 still unsaved.
    assert queued(coord) == {(L2, '*', PRIMARY): 2, (L3, '*', PRIMARY): 2,
                             (L5, '*', PRIMARY): 2}
    assert [a[0] for a in host.fLog.args('info_cache', 'GetDiskMTime')] == [L1, L2, L3]

    class Unordered(float):
        def __ne__(self, other):
            raise Boom('cannot compare')

    host.fInfoCache.fMTimes[L1] = Unordered(3.0)
    with pytest.raises(Boom):
        add_imports(coord, [b':im1'])


@pytest.mark.parametrize('priority, passed', [(2, False), (1, False), (0, True)])
def test_files_queued_more_urgently_are_left_alone(coord, host, priority, passed):
    host.fFactory.fModuleLocs.update({'m1': L1, 'm2': L2})
    coord.AddPairsToPrimaryQueue([(L1, '*')], priority=1)
    coord.AddPairsToPrimaryQueue([(L1, 'f')], priority=2)  # only the whole file counts
    add_imports(coord, [b':im1', b':im2'], priority=priority)
    assert queued(coord)[(L1, '*', PRIMARY)] == (0 if passed else 1)
    assert queued(coord)[(L2, '*', PRIMARY)] == priority


def test_unready_remote_files_are_always_passed_on(coord, host, monkeypatch):
    far, near = remote('lib/far.py'), remote('lib/near.py')
    host.fFactory.fModuleLocs.update({'far': far, 'near': near, 'm1': L1})
    coord.AddPairsToPrimaryQueue([(remote('other/x.py'), '*')])  # some remote file queued
    monkeypatch.setitem(location._gInspections._fStats, near,
                        location.CStatInfo(True, False, 100.0, 10))
    coord._fMTimeAtLastWholeFileCheck.update({near: 100.0, L1: 100.0})
    add_imports(coord, [b':ifar;:inear;:im1'], priority=2)
    assert [a[0] for a in host.fLog.args('info_cache', 'GetDiskMTime')] == [L1, near]
    assert (far, '*', PRIMARY, 2) in waiting(coord)
    assert all(loc not in (near, L1) for loc, _s, _n in queued(coord))
    host.fFactory.Fail('_FindPrimaryLocsForNames', Boom('no path'))
    with pytest.raises(Boom):
        add_imports(coord, [b':ios'])


def test_the_modtime_dict_from_buffers_and_disk(coord, host):
    host.fCacheMgr.OpenBuffer(L2, modified=True, mtime=7.0)
    host.fCacheMgr.OpenBuffer(L3, modified=False, mtime=42.5)
    host.fInfoCache.fMTimes.update({L1: 11.0, L4: 0.0})
    record_signals(coord, host.fLog, 'modtimes-updated')
    result = coord._CScanCoordinator__GetModtimeDict(iter([L1, L2, L3, L4]))
    assert result == {L1: 11.0, L2: -2, L3: 42.5, L4: 0.0} and type(result[L2]) is int
    assert list(result) == [L2, L3, L1, L4]  # buffers first, then the disk
    assert [(c.who, c.what, c.args) for c in host.fLog] == [
        ('cache_mgr', 'DoesCacheBufferExist', (L1, True)),
        ('cache_mgr', 'DoesCacheBufferExist', (L2, True)), ('buffer', 'IsModified', (L2,)),
        ('cache_mgr', 'DoesCacheBufferExist', (L3, True)), ('buffer', 'IsModified', (L3,)),
        ('buffer', '_GetLastKnownModTime', (L3,)),
        ('cache_mgr', 'DoesCacheBufferExist', (L4, True)),
        ('info_cache', 'GetDiskMTime', (L1,)), ('info_cache', 'GetDiskMTime', (L4,)),
        ('signal', 'modtimes-updated', (result,))]
    assert host.fLog[-1].args[0] is result
    host.fLog.clear()
    host.fInfoCache.Fail('GetDiskMTime', Boom('disk gone'))
    with pytest.raises(Boom):  # before the signal
        coord._CScanCoordinator__GetModtimeDict([L1])
    assert host.fLog.find('signal') == []


@pytest.mark.parametrize('force', [False, True])
def test_get_modtimes_waits_for_inspection(coord, host, monkeypatch, force, capsys):
    waits = []
    monkeypatch.setattr(location, '_WaitForInspectMultiple',
                        lambda seq, callback, force=False: waits.append((seq, callback, force)))
    record_signals(coord, host.fLog, 'modtimes-updated')
    got = []
    locs = [L1, L2]
    assert coord._CScanCoordinator__GetModtimes(locs, got.append, *([force] * force)) is None
    [(seq, callback, passed_force)] = waits
    assert seq is locs and passed_force is force and got == [] and host.fLog == []
    callback(False)
    assert got == [{L1: 100.0, L2: 100.0}]
    assert [c.what for c in host.fLog if c.who != 'cache_mgr'] == [
        'GetDiskMTime', 'GetDiskMTime', 'modtimes-updated']
    host.fLog.clear()
    callback(True)  # the remote agent aborted
    assert capsys.readouterr().out == (
        f'Skipping modtime processing due to remote agent abort: {locs}\n')
    assert len(got) == 1 and host.fLog == []
