"""CDestroyable: declared signals, connections, emission, destroy() and hooks,
reference cycles and the bounds of the owner-side bookkeeping (the C API is
what every coordinator test goes through).
Most behaviour is checked on the class itself, a bare Python subclass, and a
subclass with its own __init__ and _destroy_impl."""
import gc
import weakref

import pytest
from ostrelbase import destroyable
from ostrelbase.destroyable import CDestroyable

SIGNALS = ("changed", "gone")


class Counting(CDestroyable):
    def __init__(self, extra=()):
        super().__init__(SIGNALS + tuple(extra))
        self.impl_calls = 0

    def _destroy_impl(self):
        self.impl_calls += 1

    def handler(self, *args):
        pass


class Sub(Counting):
    pass


class NoInit(CDestroyable):
    def __init__(self):
        pass


@pytest.fixture(params=["base", "bare-subclass", "counting-subclass"])
def make(request):
    return {"base": lambda: CDestroyable(SIGNALS),
            "bare-subclass": lambda: type("Bare", (CDestroyable,), {})(SIGNALS),
            "counting-subclass": Counting}[request.param]


def recorder():
    calls = []
    return calls, lambda name: (lambda *args: calls.append((name, args)))


def names(calls):
    return [name for name, _ in calls]


def test_fields_and_declarations(make):
    calls, prefix = [], "chan"
    named = CDestroyable(s for s in [type("Name", (str,), {})(prefix + "ged")])
    named.connect("changed", lambda: calls.append(1))  # names match by value
    named.emit(f"{prefix}ged")
    assert calls == [1]
    obj = make()
    assert (obj._CDestroyable__fAlwaysDestroyOnMainThread, obj._CDestroyable__fDestroyed,
            obj._CDestroyable__fSignalCatchers) == (False, False, None)
    obj.connect("changed", print)
    assert [(k, len(v)) for k, v in obj._CDestroyable__fSignalCatchers.items()] == [("changed", 1)]
    for name in ("AlwaysDestroyOnMainThread", "Destroyed", "SignalCatchers"):
        with pytest.raises(AttributeError):
            setattr(obj, "_CDestroyable__f" + name, None)
    obj.destroy()
    assert obj._CDestroyable__fDestroyed is True


@pytest.mark.parametrize("call, exc, message", [
    (lambda: CDestroyable("changed"), TypeError, "not a single str"),
    (lambda: CDestroyable(("a", 1)), TypeError, "^signal names must be str, not int$"),
    (lambda: Sub().connect("foo", print), ValueError, "^Signal 'foo' is not declared by Sub$"),
    (lambda: Sub().connect_while_alive("foo", print, Sub()), ValueError, "declared by Sub$"),
    (lambda: Sub().emit("foo"), ValueError, "^Signal 'foo' is not declared by Sub$"),
    (lambda: CDestroyable().emit(42), ValueError, "^Signal 42 is not declared by CDestroyable$"),
    (lambda: NoInit().connect("changed", print), ValueError, "declared by NoInit$"),
    (lambda: Sub().emit(), TypeError, r"^emit\(\) missing required argument 'signal'$"),
    (lambda: Sub().connect("changed", 3), TypeError, "^callback must be callable, not int$"),
    (lambda: Sub().connect_while_alive("changed", print, object()), TypeError,
     "^owner must be a CDestroyable, not object$"),
    (lambda: Sub()._register_destroy_hook(1), TypeError,
     "^destroy hook must be callable, not int$"),
])
def test_argument_errors(call, exc, message):
    with pytest.raises(exc, match=message):
        call()


def test_instances_and_weak_references():
    with pytest.raises(AttributeError):
        CDestroyable().anything = 1
    refs = [weakref.ref(CDestroyable()), weakref.ref(Sub())]
    assert [r() for r in refs] == [None, None]
    obj = NoInit()  # declares nothing, but works
    ran = []
    obj._register_destroy_hook(lambda: ran.append(1))
    obj.destroy()
    assert ran == [1]
    # Class-wide connections cannot know what instances will declare.
    owner = Counting()
    assert Sub.class_connect_while_alive("foo", print, owner) is not None
    owner.destroy()


def test_emit_order_and_arguments(make):
    obj, owner = make(), Counting()
    calls, rec = recorder()
    payload = [1]
    obj.connect("changed", rec("first"))
    obj.connect("gone", rec("other signal"))
    obj.connect("changed", rec("second"))
    assert obj.emit("changed", obj, payload) is None
    assert calls == [("first", (obj, payload)), ("second", (obj, payload))]
    calls.clear()
    # Class-wide handlers follow the instance's own, the most derived class first.
    sub = Sub()
    for cls in (Counting, Sub, CDestroyable):
        cls.class_connect_while_alive("changed", rec(cls.__name__), owner)
    sub.connect("changed", rec("instance"))
    sub.emit("changed", 7)
    assert calls == [(n, (7,)) for n in ("instance", "Sub", "Counting", "CDestroyable")]
    owner.destroy()


def test_changes_during_an_emission(make):
    obj, owner = make(), Counting()
    calls, rec = recorder()
    ids = {}

    def first(*args):
        calls.append(("first", args))
        obj.disconnect(ids["first"])
        obj.disconnect(ids["second"])  # not called any more in this emission
        obj.connect("changed", rec("late"))  # waits for the next emission
        CDestroyable.class_connect_while_alive("changed", rec("late class"), owner)

    ids["first"] = obj.connect("changed", first)
    ids["second"] = obj.connect("changed", rec("second"))
    obj.connect("changed", rec("third"))
    obj.emit("changed")
    assert names(calls) == ["first", "third"]
    calls.clear()
    obj.emit("changed")
    assert names(calls) == ["third", "late", "late class"]
    owner.destroy()


@pytest.mark.parametrize("stop", ["destroy", "raise"])
def test_a_handler_can_stop_the_emission(make, stop):
    obj = make()
    calls, rec = recorder()
    obj.connect("changed", rec("before"))
    obj.connect("changed", lambda *a: obj.destroy() if stop == "destroy" else 1 / 0)
    obj.connect("changed", rec("after"))
    if stop == "raise":
        with pytest.raises(ZeroDivisionError):
            obj.emit("changed")
    else:
        obj.emit("changed")
    assert names(calls) == ["before"]


def test_connect_while_alive_ends_with_the_owner_or_the_emitter(make):
    emitter, owner = make(), Counting()
    calls, rec = recorder()
    emitter.connect("changed", rec("plain"))
    emitter.connect_while_alive("changed", rec("owned"), owner)
    emitter.emit("changed")
    owner.destroy()
    emitter.emit("changed")
    assert names(calls) == ["plain", "owned", "plain"]
    assert destroyable._debug_owned_count(owner) == 0
    assert emitter.connect_while_alive("changed", rec("late"), owner) is None
    other = Counting()
    emitter.connect_while_alive("changed", rec("h"), other)
    assert destroyable._debug_owned_count(other) == 1
    emitter.destroy()
    assert destroyable._debug_owned_count(other) == 0
    assert emitter._CDestroyable__fSignalCatchers is None


def test_class_connect_while_alive_reaches_subclasses_until_owner_or_class_goes():
    before = destroyable._debug_class_registry_size()
    owner = Counting()
    calls, rec = recorder()
    cid = Counting.class_connect_while_alive("gone", rec("cls"), owner)
    Sub().emit("gone", 1)
    Counting().emit("gone", 2)
    CDestroyable(SIGNALS).emit("gone", 3)  # a base instance is not covered
    assert calls == [("cls", (1,)), ("cls", (2,))]
    Counting.class_disconnect(cid)
    Sub().emit("gone")
    assert len(calls) == 2 and destroyable._debug_owned_count(owner) == 0
    Sub.class_connect_while_alive("gone", rec("again"), owner)
    assert destroyable._debug_class_registry_size() == before + 1
    owner.destroy()
    Sub().emit("gone")
    assert len(calls) == 2 and destroyable._debug_class_registry_size() == before
    assert Sub.class_connect_while_alive("gone", print, owner) is None


def test_destroy_runs_destroy_impl_once_with_handlers_still_connected():
    obj = Counting()
    calls, rec = recorder()

    class Announcing(Counting):
        def _destroy_impl(self):
            super()._destroy_impl()
            self.emit("gone", self)
            calls.append(("owned", obj.connect_while_alive("changed", print, self)))

    ann = Announcing()
    ann.connect("gone", rec("ann"))
    ann.destroy()
    ann.destroy()
    assert ann.impl_calls == 1 and calls == [("ann", (ann,)), ("owned", None)]
    assert ann._CDestroyable__fSignalCatchers is None


@pytest.mark.parametrize("fail_in", ["_destroy_impl", "hook"])
def test_a_failure_while_destroying_propagates_after_the_teardown(fail_in):
    obj, emitter = Counting(), Counting()
    if fail_in == "_destroy_impl":
        obj._destroy_impl = lambda: {}["boom"]
    else:
        obj._register_destroy_hook(lambda: {}["boom"])
    ran = []
    obj._register_destroy_hook(lambda: ran.append("hook"))
    emitter.connect_while_alive("changed", print, obj)
    with pytest.raises(KeyError, match="boom"):
        obj.destroy()
    assert ran == ["hook"] and obj._CDestroyable__fDestroyed
    assert emitter._CDestroyable__fSignalCatchers == {}
    obj.destroy()  # already destroyed: does nothing, raises nothing


def test_destroy_hooks(make):
    obj = make()
    ran = []
    tokens = {}
    tokens["a"] = obj._register_destroy_hook(lambda: ran.append("a"))
    tokens["b"] = obj._register_destroy_hook(lambda: obj._unregister_destroy_hook(tokens["d"]))
    tokens["c"] = obj._register_destroy_hook(lambda: ran.append("c"))
    tokens["d"] = obj._register_destroy_hook(lambda: ran.append("d"))
    tokens["e"] = obj._register_destroy_hook(lambda: ran.append("e"))
    obj._unregister_destroy_hook(tokens["c"])
    for junk in (tokens["c"], None, "x", 10**30):
        obj._unregister_destroy_hook(junk)
    obj.destroy()
    obj.destroy()
    assert ran == ["a", "e"]
    assert obj._register_destroy_hook(lambda: ran.append("late")) is None
    assert ran == ["a", "e", "late"]


@pytest.mark.parametrize("destroy_first", [False, True])
def test_self_referencing_handlers_are_collected(destroy_first):
    obj = Counting()
    obj.connect("changed", obj.handler)
    obj.connect_while_alive("gone", obj.handler, obj)
    obj._register_destroy_hook(obj.handler)
    if destroy_first:
        obj.destroy()
    ref = weakref.ref(obj)
    del obj
    gc.collect()
    assert ref() is None


def test_owner_emitter_cycles_are_collected():
    before = destroyable._debug_class_registry_size()
    owner, emitter = Counting(), Counting()
    owner.emitter, emitter.owner = emitter, owner
    emitter.connect_while_alive("changed", owner.handler, owner)
    # The class keeps no strong reference: an owner dropped without destroy() is
    # collected and its class-wide connection ends with it.
    Sub.class_connect_while_alive("gone", emitter.handler, emitter)
    refs = [weakref.ref(owner), weakref.ref(emitter)]
    del owner, emitter
    gc.collect()
    assert [r() for r in refs] == [None, None]
    assert destroyable._debug_class_registry_size() == before
    owner, emitter = Counting(), Counting()
    emitter.connect_while_alive("changed", owner.handler, owner)
    ref = weakref.ref(emitter)
    del emitter
    assert ref() is None  # the owner's records do not keep the emitter alive
    assert destroyable._debug_owned_count(owner) == 0


def test_owner_records_stay_bounded():
    owner, emitter = Counting(), Counting()
    for _ in range(10_000):
        emitter.disconnect(emitter.connect_while_alive("changed", owner.handler, owner))
        owner._unregister_destroy_hook(owner._register_destroy_hook(owner.handler))
        Counting.class_disconnect(
            Counting.class_connect_while_alive("changed", owner.handler, owner))
        Counting().connect_while_alive("changed", owner.handler, owner)
        emitter.connect_while_alive("changed", print, Counting())
    assert destroyable._debug_owned_count(owner) == 0
    assert emitter._CDestroyable__fSignalCatchers == {}
