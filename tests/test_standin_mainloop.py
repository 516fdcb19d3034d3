"""The stand-in host's main loop (guiutils.ostrelgtk), singletons and exception reporting."""
import logging

import pytest
import singleton
from guiutils import ostrelgtk
from ostrelbase import destroyable
from ostrelutils import reflect


@pytest.fixture
def clock():
    fake = ostrelgtk.CFakeClock(1000.0)
    ostrelgtk.set_clock(fake)
    return fake


class CountingOwner(destroyable.CDestroyable):
    """An owner that counts its destroy hooks, to show that none accumulate."""

    def __init__(self):
        super().__init__(('ping',))
        self.registered = self.unregistered = 0

    def _register_destroy_hook(self, fn):
        self.registered += 1
        return super()._register_destroy_hook(fn)

    def _unregister_destroy_hook(self, token):
        self.unregistered += 1
        return super()._unregister_destroy_hook(token)


def repeating(log, name, results):
    results = iter(results)
    return lambda: log.append(name) or next(results)


def test_priorities_fifo_repetition_and_removal(clock):
    log = []
    for name, prio in [('low', 300), ('a', 100), ('default', None), ('b', 100), ('late', 201),
                       ('early', 199)]:
        ostrelgtk.idle_add(log.append, name, **({} if prio is None else {'priority': prio}))
    removed = ostrelgtk.idle_add(log.append, 'removed')
    assert ostrelgtk.idle_remove(removed) is True
    for junk in (removed, 987654, None, [1]):
        assert ostrelgtk.idle_remove(junk) is False
    assert ostrelgtk.run_until_idle()
    assert log == ['a', 'b', 'early', 'default', 'late', 'low']
    log.clear()
    ostrelgtk.idle_add(repeating(log, 'a', [True, 1, 'yes', None]))  # while the result is true
    ostrelgtk.idle_add(repeating(log, 'b', [True, False]))  # repeating idles take turns
    ostrelgtk.idle_add(repeating(log, '', ['', True]))
    assert ostrelgtk.run_until_idle()
    assert log == ['a', 'b', '', 'a', 'b', 'a', 'a']


def test_timeouts(clock):
    times, log = [], []

    def cb():
        times.append(clock())
        clock.advance(30)  # a slow callback does not delay the next due time
        return len(times) < 3

    ostrelgtk.timeout_add(100, cb)
    for step, runs in [(99, False), (1, True), (120, True), (69, False), (1, True),
                       (1000, False)]:
        clock.advance(step)
        assert ostrelgtk.iteration() is runs
    assert times == [1100.0, 1250.0, 1350.0]
    # Due timeouts run in due order, before idles of their priority.
    ostrelgtk.idle_add(log.append, 'idle')
    ostrelgtk.timeout_add(50, log.append, 'second')
    ostrelgtk.timeout_add(30, log.append, 'first')
    ostrelgtk.timeout_add(50, log.append, 'low-timeout', priority=300)
    assert ostrelgtk.timeout_remove(ostrelgtk.timeout_add(5, log.append, 'removed'))
    clock.advance(50)
    while ostrelgtk.iteration():
        pass
    assert log == ['first', 'second', 'idle', 'low-timeout']
    with pytest.raises(ValueError):
        ostrelgtk.timeout_add(-1, lambda: None)


def test_sources_tied_to_an_owner(clock):
    owner = CountingOwner()
    log = []
    ostrelgtk.idle_add(log.append, 'plain')
    ostrelgtk.idle_add_while_alive(log.append, owner, 'urgent', priority=10)
    ostrelgtk.timeout_remove(ostrelgtk.timeout_add_while_alive(10, lambda: True, owner))
    ostrelgtk.idle_add_while_alive(lambda: 1 / 0, owner)
    assert ostrelgtk.run_until_idle()
    assert log == ['urgent', 'plain'] and owner.registered == owner.unregistered == 3
    ostrelgtk.idle_add_while_alive(log.append, owner, 'idle')
    ostrelgtk.timeout_add_while_alive(10, log.append, owner, 'timeout')
    owner.destroy()
    clock.advance(20)
    sid = ostrelgtk.idle_add_while_alive(log.append, owner, 'x')  # already destroyed
    assert not ostrelgtk.iteration() and not ostrelgtk.GetMainLoop().has_source(sid)
    assert len(log) == 2 and owner.unregistered == 3  # the hooks were consumed
    with pytest.raises(AttributeError):
        ostrelgtk.idle_add_while_alive(lambda: None, object())


def test_failures(clock, caplog):
    log = []
    ostrelgtk.idle_add(lambda: 1 / 0, priority=1)
    ostrelgtk.idle_add(log.append, 'next')
    with caplog.at_level(logging.ERROR, logger=reflect.kLoggerName):
        assert ostrelgtk.run_until_idle()
    assert log == ['next'] and ostrelgtk.GetMainLoop().source_count() == 0
    [record] = [r for r in caplog.records if r.name == reflect.kLoggerName]
    assert record.levelno == logging.ERROR and record.exc_info[0] is ZeroDivisionError

    def interrupt():
        raise KeyboardInterrupt

    ostrelgtk.idle_add(interrupt)
    with pytest.raises(KeyboardInterrupt):
        ostrelgtk.iteration()
    ostrelgtk.idle_add(lambda: None)
    assert ostrelgtk.iteration() and ostrelgtk.GetMainLoop().source_count() == 0


def test_singletons():
    s = singleton.GetSingletons()
    assert s is singleton.GetSingletons()
    assert all(getattr(s, name) is None for name in singleton.kSingletonNames)
    seen = []
    s.connect('changed', ostrelgtk.NoArgCallback(lambda: seen.append(s.fGuiMgr)))
    singleton.SetSingleton('fGuiMgr', 'marker')
    with pytest.raises(AttributeError):
        singleton.SetSingleton('fNoSuchMgr', 1)
    ostrelgtk.idle_add_while_alive(seen.append, s, 'ran')
    singleton.ResetSingletons()  # destroys the old object
    assert singleton.GetSingletons() is not s
    ostrelgtk.run_until_idle()
    assert seen == ['marker']
