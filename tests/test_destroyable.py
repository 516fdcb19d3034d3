"""CDestroyable: declared signals, connections, emission, destroy() and hooks,
reference cycles and the bounds of the owner-side bookkeeping.

Most behaviour is checked on three flavours: the compiled class itself, a bare
Python subclass, and a subclass with its own __init__ that counts the
_destroy_impl calls made on it.
"""
import ctypes
import gc
import weakref

import pytest
from ostrelbase import destroyable
from ostrelbase.destroyable import CDestroyable

SIGNALS = ("changed", "gone")


class Bare(CDestroyable):
    pass


class Counting(CDestroyable):
    def __init__(self, extra=()):
        super().__init__(SIGNALS + tuple(extra))
        self.impl_calls = 0

    def _destroy_impl(self):
        self.impl_calls += 1

    def handler(self, *args):
        pass


class NoInit(CDestroyable):
    def __init__(self):
        pass


class Sub(Counting):
    pass


FLAVOURS = {
    "base": lambda: CDestroyable(SIGNALS),
    "bare-subclass": lambda: Bare(SIGNALS),
    "counting-subclass": Counting,
}


@pytest.fixture(params=list(FLAVOURS))
def make(request):
    return FLAVOURS[request.param]


def recorder():
    calls = []

    def rec(name):
        return lambda *args: calls.append((name, args))

    return calls, rec


# ---- construction and fields ------------------------------------------------

def test_fields_are_readable_under_mangled_names_and_read_only(make):
    obj = make()
    assert obj._CDestroyable__fAlwaysDestroyOnMainThread is False
    assert obj._CDestroyable__fDestroyed is False
    assert obj._CDestroyable__fSignalCatchers is None
    cid = obj.connect("changed", print)
    catchers = obj._CDestroyable__fSignalCatchers
    assert list(catchers) == ["changed"] and len(catchers["changed"]) == 1
    for name in ("AlwaysDestroyOnMainThread", "Destroyed", "SignalCatchers"):
        with pytest.raises(AttributeError):
            setattr(obj, "_CDestroyable__f" + name, None)
    obj.disconnect(cid)
    obj.destroy()
    assert obj._CDestroyable__fDestroyed is True


def test_signals_accept_any_sequence_of_str():
    assert CDestroyable(signals=["a"]).connect("a", print) > 0
    assert CDestroyable(s for s in ("a", "b")).connect("b", print) > 0
    # Names built at run time are neither interned nor identical to the
    # declared ones: they still match by value.
    class Name(str):
        pass

    prefix = "chan"
    obj = CDestroyable([Name(prefix + "ged")])
    calls = []
    obj.connect(prefix + "ged", lambda: calls.append(1))
    obj.emit(f"{prefix}ged")
    assert calls == [1]
    with pytest.raises(TypeError, match="not a single str"):
        CDestroyable("changed")
    with pytest.raises(TypeError, match="signal names must be str, not int"):
        CDestroyable(("a", 1))


def test_wrong_argument_counts_raise_type_error():
    obj = Counting()
    for call in (lambda: CDestroyable(SIGNALS, 1), lambda: obj.connect("changed"),
                 lambda: obj.connect_while_alive("changed", print),
                 lambda: obj.disconnect(), lambda: obj.destroy(1),
                 lambda: Counting.class_connect_while_alive("changed", print),
                 lambda: obj.emit("changed", key=1),
                 lambda: obj._register_destroy_hook()):
        with pytest.raises(TypeError):
            call()
    with pytest.raises(TypeError, match=r"^emit\(\) missing required argument 'signal'$"):
        obj.emit()


def test_base_has_no_dict_but_subclasses_do_and_all_take_weakrefs():
    with pytest.raises(AttributeError):
        CDestroyable().anything = 1
    obj = Bare()
    obj.anything = 1
    base = CDestroyable()
    refs = [weakref.ref(base), weakref.ref(obj)]
    del base, obj
    assert [r() for r in refs] == [None, None]


def test_subclass_without_init_declares_nothing_but_works():
    obj = NoInit()
    with pytest.raises(ValueError, match="^Signal 'changed' is not declared by NoInit$"):
        obj.connect("changed", print)
    ran = []
    obj._register_destroy_hook(lambda: ran.append(1))
    obj.destroy()
    assert ran == [1]


def test_undeclared_signal_error_names_signal_and_class():
    obj, owner = Sub(), Counting()
    expected = "^Signal 'foo' is not declared by Sub$"
    with pytest.raises(ValueError, match=expected):
        obj.connect("foo", print)
    with pytest.raises(ValueError, match=expected):
        obj.connect_while_alive("foo", print, owner)
    with pytest.raises(ValueError, match=expected):
        obj.emit("foo")
    with pytest.raises(ValueError, match="^Signal 42 is not declared by CDestroyable$"):
        CDestroyable(SIGNALS).emit(42)
    # Class-wide connections cannot know what instances will declare.
    assert Sub.class_connect_while_alive("foo", print, owner) is not None
    owner.destroy()


# ---- emission ---------------------------------------------------------------

def test_emit_order_and_arguments(make):
    obj = make()
    calls, rec = recorder()
    payload = [1]
    obj.connect("changed", rec("first"))
    obj.connect("gone", rec("other signal"))
    obj.connect("changed", rec("second"))
    assert obj.emit("changed", obj, payload, None) is None
    assert calls == [("first", (obj, payload, None)), ("second", (obj, payload, None))]
    assert calls[0][1][1] is payload


def test_class_wide_handlers_follow_instance_ones_most_derived_first():
    owner = Counting()
    calls, rec = recorder()
    obj = Sub()
    Counting.class_connect_while_alive("changed", rec("Counting"), owner)
    Sub.class_connect_while_alive("changed", rec("Sub"), owner)
    CDestroyable.class_connect_while_alive("changed", rec("CDestroyable"), owner)
    obj.connect("changed", rec("instance"))
    obj.emit("changed", 7)
    assert [name for name, _ in calls] == ["instance", "Sub", "Counting", "CDestroyable"]
    assert all(args == (7,) for _, args in calls)
    calls.clear()
    Counting().emit("changed")  # not an instance of Sub
    assert [name for name, _ in calls] == ["Counting", "CDestroyable"]
    owner.destroy()


def test_handlers_connected_during_emission_wait_for_the_next_one(make):
    obj, owner = make(), Counting()
    calls, rec = recorder()

    def connect_more(*args):
        obj.connect("changed", rec("late"))
        CDestroyable.class_connect_while_alive("changed", rec("late class"), owner)

    obj.connect("changed", connect_more)
    obj.emit("changed")
    assert calls == []
    obj.emit("changed")
    assert [name for name, _ in calls] == ["late", "late class"]
    owner.destroy()


def test_handlers_disconnected_during_emission_are_not_called(make):
    obj = make()
    calls, rec = recorder()
    ids = {}

    def first(*args):
        calls.append(("first", args))
        obj.disconnect(ids["first"])  # itself: harmless
        obj.disconnect(ids["second"])

    ids["first"] = obj.connect("changed", first)
    ids["second"] = obj.connect("changed", rec("second"))
    obj.connect("changed", rec("third"))
    obj.emit("changed")
    assert [name for name, _ in calls] == ["first", "third"]
    calls.clear()
    obj.emit("changed")
    assert [name for name, _ in calls] == ["third"]


def test_destroy_from_a_handler_stops_the_emission(make):
    obj = make()
    calls, rec = recorder()
    obj.connect("changed", lambda *a: obj.destroy())
    obj.connect("changed", rec("after"))
    obj.emit("changed")
    assert calls == []


def test_handler_exception_propagates_and_stops_emission(make):
    obj = make()
    calls, rec = recorder()
    obj.connect("changed", rec("before"))
    obj.connect("changed", lambda *a: 1 / 0)
    obj.connect("changed", rec("after"))
    with pytest.raises(ZeroDivisionError):
        obj.emit("changed")
    assert [name for name, _ in calls] == ["before"]


def test_disconnect_ignores_unknown_ids_and_ids_are_unique(make):
    a, b = make(), make()
    ids = [a.connect("changed", print), b.connect("changed", print), a.connect("gone", print)]
    assert len(set(ids)) == 3 and all(isinstance(i, int) for i in ids)
    for junk in (None, "x", 10**30, -1, ids[1]):  # ids[1] belongs to b
        a.disconnect(junk)
    assert len(a._CDestroyable__fSignalCatchers["changed"]) == 1
    a.disconnect(ids[0])
    a.disconnect(ids[0])
    assert "changed" not in a._CDestroyable__fSignalCatchers


def test_callback_must_be_callable():
    obj = Counting()
    with pytest.raises(TypeError, match="^callback must be callable, not int$"):
        obj.connect("changed", 3)
    with pytest.raises(TypeError, match="^owner must be a CDestroyable, not object$"):
        obj.connect_while_alive("changed", print, object())


# ---- while-alive connections ------------------------------------------------

def test_connect_while_alive_ends_with_owner(make):
    emitter, owner = make(), Counting()
    calls, rec = recorder()
    emitter.connect("changed", rec("plain"))
    emitter.connect_while_alive("changed", rec("owned"), owner)
    emitter.emit("changed")
    owner.destroy()
    emitter.emit("changed")
    assert [name for name, _ in calls] == ["plain", "owned", "plain"]
    assert destroyable._debug_owned_count(owner) == 0
    # A destroyed owner gets no connection at all.
    assert emitter.connect_while_alive("changed", rec("late"), owner) is None
    assert len(emitter._CDestroyable__fSignalCatchers["changed"]) == 1


def test_emitter_destroyed_before_owner():
    emitter, owner = Counting(), Counting()
    calls, rec = recorder()
    emitter.connect_while_alive("changed", rec("h"), owner)
    assert destroyable._debug_owned_count(owner) == 1
    emitter.destroy()
    assert destroyable._debug_owned_count(owner) == 0
    emitter.emit("changed")
    owner.destroy()
    assert calls == [] and emitter._CDestroyable__fSignalCatchers is None


def test_class_connect_while_alive_reaches_subclasses_until_owner_destroyed():
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
    owner.destroy()
    Sub().emit("gone")
    assert len(calls) == 2
    assert Sub.class_connect_while_alive("gone", print, owner) is None


def test_class_wide_entries_go_with_their_owner_or_class():
    before = destroyable._debug_class_registry_size()
    owner = Counting()
    Sub.class_connect_while_alive("gone", print, owner)
    assert destroyable._debug_class_registry_size() == before + 1
    owner.destroy()
    assert destroyable._debug_class_registry_size() == before

    owner = Counting()
    Temp = type("Temp", (Counting,), {})
    Temp.class_connect_while_alive("gone", print, owner)
    assert destroyable._debug_owned_count(owner) == 1
    del Temp
    gc.collect()
    assert destroyable._debug_class_registry_size() == before
    assert destroyable._debug_owned_count(owner) == 0


# ---- destroy and hooks -----------------------------------------------------

def test_destroy_runs_destroy_impl_once_with_handlers_still_connected():
    obj = Counting()
    calls, rec = recorder()

    class Announcing(Counting):
        def _destroy_impl(self):
            super()._destroy_impl()
            self.emit("gone", self)
            # Too late to own anything new.
            assert obj.connect_while_alive("changed", print, self) is None

    ann = Announcing()
    ann.connect("gone", rec("ann"))
    ann.destroy()
    ann.destroy()
    assert ann.impl_calls == 1 and calls == [("ann", (ann,))]
    assert ann._CDestroyable__fSignalCatchers is None


def test_destroy_impl_error_propagates_after_teardown():
    class Failing(Counting):
        def _destroy_impl(self):
            raise KeyError("boom")

    obj, emitter = Failing(), Counting()
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
    with pytest.raises(TypeError, match="^destroy hook must be callable, not int$"):
        make()._register_destroy_hook(1)


def test_failing_hook_does_not_stop_the_others():
    obj, emitter = Counting(), Counting()
    ran = []
    obj._register_destroy_hook(lambda: 1 / 0)
    obj._register_destroy_hook(lambda: ran.append("second"))
    emitter.connect_while_alive("changed", print, obj)
    with pytest.raises(ZeroDivisionError):
        obj.destroy()
    assert ran == ["second"] and emitter._CDestroyable__fSignalCatchers == {}


# ---- memory -----------------------------------------------------------------

def collected(*objs):
    refs = [weakref.ref(o) for o in objs]
    del objs
    gc.collect()
    return [r() is None for r in refs]


@pytest.mark.parametrize("destroy_first", [False, True])
def test_self_referencing_handler_is_collected(destroy_first):
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


def test_owner_emitter_cycle_is_collected():
    before = destroyable._debug_class_registry_size()
    owner, emitter = Counting(), Counting()
    owner.emitter, emitter.owner = emitter, owner
    emitter.connect_while_alive("changed", owner.handler, owner)
    # The class keeps no strong reference: an owner dropped without destroy()
    # is collected and its class-wide connection ends with it.
    Sub.class_connect_while_alive("gone", emitter.handler, emitter)
    assert destroyable._debug_class_registry_size() == before + 1
    refs = [weakref.ref(owner), weakref.ref(emitter)]
    del owner, emitter
    gc.collect()
    assert [r() for r in refs] == [None, None]
    assert destroyable._debug_class_registry_size() == before


def test_owner_records_do_not_keep_the_emitter_alive():
    owner = Counting()
    emitter = Counting()
    emitter.connect_while_alive("changed", owner.handler, owner)
    ref = weakref.ref(emitter)
    del emitter
    assert ref() is None  # freed by reference counting alone
    assert destroyable._debug_owned_count(owner) == 0


def test_owner_records_stay_bounded():
    owner = Counting()
    emitter = Counting()
    for _ in range(10_000):
        emitter.disconnect(emitter.connect_while_alive("changed", owner.handler, owner))
        owner._unregister_destroy_hook(owner._register_destroy_hook(owner.handler))
        Counting.class_disconnect(
            Counting.class_connect_while_alive("changed", owner.handler, owner))
    assert destroyable._debug_owned_count(owner) == 0
    assert emitter._CDestroyable__fSignalCatchers == {}
    for _ in range(10_000):
        Counting().connect_while_alive("changed", owner.handler, owner)
    assert destroyable._debug_owned_count(owner) == 0
    # An owner that goes away without destroy() leaves nothing on the emitter.
    for _ in range(10_000):
        emitter.connect_while_alive("changed", print, Counting())
    assert emitter._CDestroyable__fSignalCatchers == {}


# ---- C API ---------------------------------------------------------------------

class CAPI(ctypes.Structure):
    _fields_ = [
        ("abi_version", ctypes.c_uint),
        ("object_size", ctypes.c_size_t),
        ("type", ctypes.py_object),
        ("init", ctypes.PYFUNCTYPE(ctypes.c_int, ctypes.py_object, ctypes.py_object)),
        ("emit", ctypes.PYFUNCTYPE(ctypes.c_int, ctypes.py_object, ctypes.py_object,
                                   ctypes.POINTER(ctypes.py_object), ctypes.c_ssize_t)),
        ("connect_while_alive", ctypes.PYFUNCTYPE(ctypes.py_object, ctypes.py_object,
                                                  ctypes.py_object, ctypes.py_object,
                                                  ctypes.py_object)),
        ("destroy", ctypes.PYFUNCTYPE(ctypes.c_int, ctypes.py_object)),
        ("is_destroyed", ctypes.PYFUNCTYPE(ctypes.c_int, ctypes.py_object)),
    ]


def test_capsule_table():
    name = b"ostrelbase.destroyable._C_API"
    api = ctypes.pythonapi
    api.PyCapsule_IsValid.argtypes = [ctypes.py_object, ctypes.c_char_p]
    api.PyCapsule_GetPointer.argtypes = [ctypes.py_object, ctypes.c_char_p]
    api.PyCapsule_GetPointer.restype = ctypes.c_void_p
    assert api.PyCapsule_IsValid(destroyable._C_API, name) == 1
    table = CAPI.from_address(api.PyCapsule_GetPointer(destroyable._C_API, name))
    assert table.abi_version == 1
    assert table.object_size == CDestroyable.__basicsize__
    assert table.type is CDestroyable

    obj, owner = NoInit(), Counting()
    assert table.init(obj, ("changed",)) == 0
    calls, rec = recorder()
    cid = table.connect_while_alive(obj, "changed", rec("h"), owner)
    args = (ctypes.py_object * 2)(obj, 5)
    assert table.emit(obj, "changed", args, 2) == 0
    assert calls == [("h", (obj, 5))]
    with pytest.raises(ValueError, match="^Signal 'nope' is not declared by NoInit$"):
        table.emit(obj, "nope", args, 0)
    assert table.is_destroyed(owner) == 0
    assert table.destroy(owner) == 0 and table.is_destroyed(owner) == 1
    obj.disconnect(cid)
    assert table.connect_while_alive(obj, "changed", print, owner) is None
