"""The stand-in host's main loop (guiutils.ostrelgtk), singletons and exception reporting."""
import gc
import logging
import weakref

import pytest
import singleton
from guiutils import ostrelgtk
from ostrelbase import destroyable
from ostrelutils import reflect


@pytest.fixture
def clock():
    ostrelgtk.reset()
    fake = ostrelgtk.CFakeClock(1000.0)
    ostrelgtk.set_clock(fake)
    yield fake
    ostrelgtk.reset()


class CountingOwner(destroyable.CDestroyable):
    """An owner that counts its destroy hooks, to show that none accumulate."""

    def __init__(self):
        super().__init__(('ping',))
        self.registered = 0
        self.unregistered = 0

    def _register_destroy_hook(self, fn):
        self.registered += 1
        return super()._register_destroy_hook(fn)

    def _unregister_destroy_hook(self, token):
        self.unregistered += 1
        return super()._unregister_destroy_hook(token)


def drain(limit=1000):
    for _ in range(limit):
        if not ostrelgtk.iteration():
            return
    raise AssertionError('loop did not drain')


class TestOrdering:
    def test_lower_priority_first_fifo_among_equals(self, clock):
        log = []
        for name, prio in [('low', 300), ('a', 100), ('default', None), ('b', 100),
                           ('c', 100)]:
            kw = {} if prio is None else {'priority': prio}
            ostrelgtk.idle_add(log.append, name, **kw)
        drain()
        assert log == ['a', 'b', 'c', 'default', 'low']

    def test_default_idle_priority_is_200(self, clock):
        log = []
        ostrelgtk.idle_add(log.append, 'late', priority=201)
        ostrelgtk.idle_add(log.append, 'default')
        ostrelgtk.idle_add(log.append, 'early', priority=199)
        drain()
        assert log == ['early', 'default', 'late']

    def test_repeating_idles_of_equal_priority_take_turns(self, clock):
        log = []

        def make(name, times):
            left = [times]

            def cb():
                log.append(name)
                left[0] -= 1
                return left[0] > 0
            return cb
        ostrelgtk.idle_add(make('a', 3))
        ostrelgtk.idle_add(make('b', 2))
        drain()
        assert log == ['a', 'b', 'a', 'b', 'a']

    def test_idle_repeats_while_result_is_true(self, clock):
        results = iter([True, 1, 'yes', [0], None])
        calls = []

        def cb():
            calls.append(1)
            return next(results)
        sid = ostrelgtk.idle_add(cb)
        drain()
        assert len(calls) == 5
        assert not ostrelgtk.GetMainLoop().has_source(sid)

    def test_false_like_results_end_the_idle(self, clock):
        for value in (False, 0, '', [], None):
            calls = []
            ostrelgtk.idle_add(lambda v=value, c=calls: c.append(1) or v)
            drain()
            assert calls == [1]

    def test_ids_are_unique_ints(self, clock):
        ids = [ostrelgtk.idle_add(lambda: None) for _ in range(5)]
        ids += [ostrelgtk.timeout_add(10, lambda: None) for _ in range(5)]
        assert all(isinstance(i, int) for i in ids)
        assert len(set(ids)) == 10
        drain()
        assert ostrelgtk.idle_add(lambda: None) not in ids


class TestTimeouts:
    def test_timeout_waits_for_the_clock_and_repeats_from_dispatch_time(self, clock):
        times = []

        def cb():
            times.append(clock())
            clock.advance(30)  # a slow callback does not delay the next due time
            return len(times) < 3
        ostrelgtk.timeout_add(100, cb)
        clock.advance(99)
        assert not ostrelgtk.iteration()
        clock.advance(1)
        assert ostrelgtk.iteration()
        clock.advance(120)  # late: the next is due 100 ms after this dispatch started
        assert ostrelgtk.iteration()
        clock.advance(69)
        assert not ostrelgtk.iteration()
        clock.advance(1)
        assert ostrelgtk.iteration()
        clock.advance(1000)
        assert not ostrelgtk.iteration()
        assert times == [1100.0, 1250.0, 1350.0]

    def test_due_timeout_runs_before_idles_but_respects_priority(self, clock):
        log = []
        ostrelgtk.idle_add(log.append, 'idle')
        ostrelgtk.timeout_add(50, log.append, 'timeout')
        ostrelgtk.timeout_add(50, log.append, 'low-timeout', priority=300)
        clock.advance(50)
        drain()
        assert log == ['timeout', 'idle', 'low-timeout']

    def test_timeouts_due_together_run_in_due_order(self, clock):
        log = []
        ostrelgtk.timeout_add(30, log.append, 'second')
        ostrelgtk.timeout_add(10, log.append, 'first')
        clock.advance(100)
        drain()
        assert log == ['first', 'second']

    def test_negative_interval_rejected(self, clock):
        with pytest.raises(ValueError):
            ostrelgtk.timeout_add(-1, lambda: None)

    def test_pending_reports_only_ready_sources(self, clock):
        ostrelgtk.timeout_add(10, lambda: None)
        assert not ostrelgtk.pending()
        clock.advance(10)
        assert ostrelgtk.pending()
        drain()
        ostrelgtk.idle_add(lambda: None)
        assert ostrelgtk.pending()


class TestRemoval:
    def test_removed_sources_do_not_run(self, clock):
        log = []
        a = ostrelgtk.idle_add(log.append, 'a')
        ostrelgtk.idle_add(log.append, 'b')
        t = ostrelgtk.timeout_add(5, log.append, 't')
        assert ostrelgtk.idle_remove(a) is True
        assert ostrelgtk.timeout_remove(t) is True
        clock.advance(10)
        drain()
        assert log == ['b']

    def test_unknown_and_finished_ids_are_harmless(self, clock):
        sid = ostrelgtk.idle_add(lambda: None)
        drain()
        assert ostrelgtk.idle_remove(sid) is False
        assert ostrelgtk.timeout_remove(sid) is False
        assert ostrelgtk.idle_remove(987654) is False
        assert ostrelgtk.idle_remove(None) is False
        assert ostrelgtk.idle_remove([1]) is False  # unhashable
        kept = ostrelgtk.idle_add(lambda: None)
        assert ostrelgtk.idle_remove(float(kept)) is False
        assert ostrelgtk.GetMainLoop().has_source(kept)
        ostrelgtk.idle_add(lambda: None)
        assert ostrelgtk.iteration()

    def test_reset_drops_everything_and_restores_the_clock(self, clock):
        owner = CountingOwner()
        ostrelgtk.idle_add(lambda: True)
        ostrelgtk.timeout_add_while_alive(10, lambda: True, owner)
        ostrelgtk.reset()
        assert ostrelgtk.GetMainLoop().source_count() == 0
        assert owner.registered == owner.unregistered == 1
        assert not ostrelgtk.iteration()
        assert ostrelgtk.GetMainLoop().now_ms() != clock()


class TestWhileAlive:
    def test_owner_destroy_cancels_idles_and_timeouts(self, clock):
        owner = CountingOwner()
        log = []
        ostrelgtk.idle_add_while_alive(log.append, owner, 'idle')
        ostrelgtk.timeout_add_while_alive(10, log.append, owner, 'timeout')
        ostrelgtk.idle_add(log.append, 'other')
        owner.destroy()
        clock.advance(20)
        drain()
        assert log == ['other']
        assert ostrelgtk.GetMainLoop().source_count() == 0

    def test_owner_already_destroyed(self, clock):
        owner = CountingOwner()
        owner.destroy()
        log = []
        sid = ostrelgtk.idle_add_while_alive(log.append, owner, 'x')
        assert isinstance(sid, int)
        assert not ostrelgtk.GetMainLoop().has_source(sid)
        drain()
        assert log == []

    def test_hooks_do_not_accumulate(self, clock):
        owner = CountingOwner()
        for _ in range(20):
            ostrelgtk.idle_add_while_alive(lambda: None, owner)
        removed = ostrelgtk.timeout_add_while_alive(10, lambda: True, owner)
        ostrelgtk.timeout_remove(removed)
        raising = ostrelgtk.idle_add_while_alive(lambda: 1 / 0, owner)
        drain()
        assert not ostrelgtk.GetMainLoop().has_source(raising)
        assert owner.registered == 22
        assert owner.unregistered == 22

    def test_callback_destroying_its_owner(self, clock):
        owner = CountingOwner()
        calls = []

        def cb():
            calls.append(1)
            owner.destroy()
            return True  # would repeat, but the owner is gone
        ostrelgtk.idle_add_while_alive(cb, owner)
        drain()
        assert calls == [1]
        assert owner.unregistered == 0  # the hook was consumed, not unregistered

    def test_owner_is_freed_once_its_sources_end(self, clock):
        owner = CountingOwner()
        ref = weakref.ref(owner)
        ostrelgtk.idle_add_while_alive(lambda: None, owner)
        ostrelgtk.timeout_add_while_alive(5, lambda: False, owner)
        clock.advance(5)
        drain()
        del owner
        gc.collect()
        assert ref() is None

    def test_owner_must_be_destroyable(self, clock):
        with pytest.raises(AttributeError):
            ostrelgtk.idle_add_while_alive(lambda: None, object())
        assert ostrelgtk.GetMainLoop().source_count() == 0

    def test_positional_args_and_priority(self, clock):
        owner = CountingOwner()
        log = []
        ostrelgtk.idle_add(log.append, 'plain')
        ostrelgtk.idle_add_while_alive(log.append, owner, 'urgent', priority=10)
        drain()
        assert log == ['urgent', 'plain']


class TestReentrancy:
    def test_callback_adds_a_more_urgent_source(self, clock):
        log = []

        def first():
            log.append('first')
            ostrelgtk.idle_add(log.append, 'added', priority=0)
        ostrelgtk.idle_add(first)
        ostrelgtk.idle_add(log.append, 'queued')
        drain()
        assert log == ['first', 'added', 'queued']

    def test_callback_removes_itself_and_others(self, clock):
        log = []
        ids = {}

        def cb():
            log.append('cb')
            ostrelgtk.idle_remove(ids['self'])
            ostrelgtk.idle_remove(ids['victim'])
            return True
        ids['self'] = ostrelgtk.idle_add(cb)
        ids['victim'] = ostrelgtk.idle_add(log.append, 'victim')
        drain()
        assert log == ['cb']

    def test_nested_iteration_never_reenters_the_running_source(self, clock):
        log = []
        depth = [0]

        def outer():
            depth[0] += 1
            log.append(('outer', depth[0]))
            while ostrelgtk.iteration():
                pass
            depth[0] -= 1
            return len(log) < 4

        ostrelgtk.idle_add(outer)
        ostrelgtk.idle_add(log.append, 'inner-a')
        ostrelgtk.idle_add(log.append, 'inner-b')
        drain()
        assert log == [('outer', 1), 'inner-a', 'inner-b', ('outer', 1)]

    def test_run_until_idle_from_a_callback_stops_at_the_running_idle(self, clock):
        results = []

        def cb():
            results.append(ostrelgtk.run_until_idle(100))
        ostrelgtk.idle_add(cb)
        ostrelgtk.idle_add(lambda: None)
        assert ostrelgtk.run_until_idle()
        assert results == [False]


class TestFailures:
    def test_raising_callback_is_reported_and_removed(self, clock, caplog):
        log = []
        ostrelgtk.idle_add(lambda: 1 / 0, priority=1)
        ostrelgtk.idle_add(log.append, 'next')
        with caplog.at_level(logging.ERROR, logger=reflect.kLoggerName):
            drain()
        assert log == ['next']
        records = [r for r in caplog.records if r.name == reflect.kLoggerName]
        assert len(records) == 1
        assert records[0].exc_info[0] is ZeroDivisionError
        assert ostrelgtk.GetMainLoop().source_count() == 0

    def test_base_exception_propagates_without_breaking_the_loop(self, clock):
        def cb():
            raise KeyboardInterrupt
        ostrelgtk.idle_add(cb)
        with pytest.raises(KeyboardInterrupt):
            ostrelgtk.iteration()
        assert ostrelgtk.GetMainLoop().source_count() == 0
        ostrelgtk.idle_add(lambda: None)
        assert ostrelgtk.iteration()


class TestRunning:
    def test_run_until_idle_bound(self, clock):
        calls = []
        ostrelgtk.idle_add(lambda: calls.append(1) or True)
        assert ostrelgtk.run_until_idle(max_iterations=50) is False
        assert len(calls) == 50

    def test_run_until_idle_finishes_and_ignores_future_timeouts(self, clock):
        counts = [3]

        def cb():
            counts[0] -= 1
            return counts[0] > 0
        ostrelgtk.idle_add(cb)
        ostrelgtk.timeout_add(10_000, lambda: None)
        assert ostrelgtk.run_until_idle()
        assert counts == [0]
        assert ostrelgtk.GetMainLoop().source_count() == 1

    def test_run_blocks_on_timeouts_until_quit(self, clock):
        ticks = []

        def tick():
            ticks.append(clock())
            if len(ticks) == 3:
                ostrelgtk.quit()
            return True
        ostrelgtk.timeout_add(1000, tick)
        ostrelgtk.run()
        assert ticks == [2000.0, 3000.0, 4000.0]

    def test_run_returns_when_nothing_is_left(self, clock):
        ostrelgtk.idle_add(lambda: None)
        ostrelgtk.run()
        assert ostrelgtk.GetMainLoop().source_count() == 0

    def test_nested_run_with_only_the_running_source_returns(self, clock):
        log = []

        def cb():
            ostrelgtk.run()  # nothing else can run: must not spin or block
            log.append('returned')
        ostrelgtk.idle_add(cb)
        ostrelgtk.run()
        assert log == ['returned']

    def test_quit_ends_the_innermost_run_only(self, clock):
        log = []

        def inner_quit():
            log.append('inner')
            ostrelgtk.quit()

        def outer():
            ostrelgtk.idle_add(inner_quit)
            ostrelgtk.run()
            log.append('after-inner')
            ostrelgtk.timeout_add(1, lambda: log.append('outer-timeout') or ostrelgtk.quit())
        ostrelgtk.idle_add(outer)
        ostrelgtk.run()
        assert log == ['inner', 'after-inner', 'outer-timeout']


class TestCallbackAdapters:
    def test_adapters_with_signals(self, clock):
        emitter = CountingOwner()
        got = []
        emitter.connect('ping', ostrelgtk.NoArgCallback(lambda: got.append('noarg')))
        emitter.connect('ping', ostrelgtk.NoObjCallback(lambda *a: got.append(a)))
        emitter.emit('ping', emitter, 1, 2)
        assert got == ['noarg', (1, 2)]

    def test_adapters_pass_results_through(self):
        assert ostrelgtk.NoArgCallback(lambda: 7)(1, 2, k=3) == 7
        assert ostrelgtk.NoObjCallback(lambda a, b=0: a + b)('obj', 1, b=2) == 3
        with pytest.raises(TypeError):
            ostrelgtk.NoObjCallback(lambda: None)()


class TestSingletonsAndReporting:
    @pytest.fixture(autouse=True)
    def fresh_singletons(self):
        singleton.ResetSingletons()
        yield
        singleton.ResetSingletons()

    def test_one_object_with_unset_managers(self):
        s = singleton.GetSingletons()
        assert s is singleton.GetSingletons()
        for name in singleton.kSingletonNames:
            assert getattr(s, name) is None

    def test_setting_emits_changed(self):
        s = singleton.GetSingletons()
        seen = []
        s.connect('changed', ostrelgtk.NoArgCallback(lambda: seen.append(s.fGuiMgr)))
        marker = object()
        singleton.SetSingleton('fGuiMgr', marker)
        assert seen == [marker]
        with pytest.raises(AttributeError):
            singleton.SetSingleton('fNoSuchMgr', 1)
        assert seen == [marker]

    def test_reset_destroys_the_old_object(self):
        old = singleton.GetSingletons()
        owner_log = []
        ostrelgtk.reset()
        ostrelgtk.idle_add_while_alive(owner_log.append, old, 'ran')
        singleton.ResetSingletons()
        assert singleton.GetSingletons() is not old
        ostrelgtk.run_until_idle()
        assert owner_log == []

    def test_report_current_exception(self, caplog):
        with caplog.at_level(logging.ERROR, logger=reflect.kLoggerName):
            try:
                raise LookupError('boom')
            except LookupError:
                reflect.ReportCurrentException()
            reflect.ReportCurrentException()
        first, second = caplog.records
        assert first.levelno == logging.ERROR and first.exc_info[0] is LookupError
        assert 'boom' in first.getMessage()
        assert second.exc_info is None and 'no exception' in second.getMessage()
