"""CUsageOrderedDict: order semantics, robustness against reentrant keys and
values, the cyclic GC, subclassing, the capsule C API, and a model-based test.

Behaviour that a subclass could disturb runs against the class itself, a bare
subclass and a subclass that counts the calls made on it.
"""
import collections
import ctypes
import gc
import random
import sys
import weakref

import pytest
from hypothesis import settings
from hypothesis import strategies as st
from hypothesis.stateful import RuleBasedStateMachine, invariant, precondition, rule

from pysource import usageordereddict as uodmod

CUsageOrderedDict = uodmod.CUsageOrderedDict

MUTATED_DURING_ITERATION = "CUsageOrderedDict mutated during iteration"
MUTATED_DURING_LOOKUP = "CUsageOrderedDict kept changing while a key was being compared"
TAKES_NO_ARGUMENTS = "CUsageOrderedDict() takes no arguments"
NO_ITEM_ASSIGNMENT = (
    "CUsageOrderedDict does not support item assignment; use Set(key, value, first)")


class Sub(CUsageOrderedDict):
    pass


class CountingSub(CUsageOrderedDict):
    def __init__(self):
        super().__init__()
        self.calls = collections.Counter()

    def items(self):
        self.calls["items"] += 1
        return super().items()

    def get(self, *args, **kwargs):
        self.calls["get"] += 1
        return super().get(*args, **kwargs)


@pytest.fixture(params=[CUsageOrderedDict, Sub, CountingSub], ids=["base", "sub", "counting"])
def cls(request):
    return request.param


class Loc:
    """A location-like key: Python-level __hash__ and __eq__, optional fixed hash."""

    def __init__(self, name, h=None):
        self.name = name
        self.h = hash(name) if h is None else h

    def __hash__(self):
        return self.h

    def __eq__(self, other):
        return isinstance(other, Loc) and (other.name, other.h) == (self.name, self.h)

    def __repr__(self):
        return f"Loc({self.name!r}, {self.h})"


def filled(cls, keys):
    d = cls()
    for k in keys:
        d.Set(k, f"v{k}")
    return d


def check_sound(d):
    """Iteration, len, membership and the ends agree with each other."""
    pairs = list(d.items())
    assert len(pairs) == len(d)
    assert all(k in d and d[k] is v for k, v in pairs)
    assert (d._fFirst is None) == (d._fLast is None) == (not pairs)
    if pairs:
        assert (d._fFirst.key, d._fLast.key) == (pairs[0][0], pairs[-1][0])


# ---- construction -------------------------------------------------------------

def test_construction_takes_no_arguments():
    d = CUsageOrderedDict()
    assert len(d) == 0 and d._fFirst is None and d._fLast is None
    for args, kwargs in [((1,), {}), ((), {"x": 1}), (([("a", 1)],), {})]:
        with pytest.raises(TypeError) as exc:
            CUsageOrderedDict(*args, **kwargs)
        assert str(exc.value) == TAKES_NO_ARGUMENTS
    with pytest.raises(TypeError):
        CUsageOrderedDict.__init__(d, 1)


def test_subclass_may_take_its_own_init_arguments():
    class WithArgs(CUsageOrderedDict):
        def __init__(self, seed):
            super().__init__()
            self.Set("seed", seed)

    d = WithArgs(7)
    assert list(d.items()) == [("seed", 7)]
    assert isinstance(d, CUsageOrderedDict) and d.__dict__ == {}


# ---- order semantics -------------------------------------------------------------

def test_set_places_at_requested_end_and_moves_existing(cls):
    d = cls()
    d.Set("a", 1)
    d.Set("b", 2)
    d.Set("c", 3, first=True)
    assert list(d.items()) == [("c", 3), ("a", 1), ("b", 2)]
    d.Set("b", 20, True)  # existing, positional flag: new value, to the front
    assert list(d.items()) == [("b", 20), ("c", 3), ("a", 1)]
    d.Set("b", 21)  # existing, to the back
    assert list(d.items()) == [("c", 3), ("a", 1), ("b", 21)]
    d.Set(key="a", value=10, first=[1])  # keywords; any true object is true
    assert list(d.items()) == [("a", 10), ("c", 3), ("b", 21)]


def test_get_moves_only_when_first_is_true(cls):
    d = filled(cls, "abcd")
    assert d.get("c") == "vc"
    assert d.get("c", None, False) == "vc"
    assert list(d) == list("abcd")
    assert d.get("c", None, True) == "vc"
    assert list(d) == list("cabd")
    assert d.get("d", default=0, first=1) == "vd"
    assert list(d) == list("dcab")
    assert d.get("zz") is None
    assert d.get("zz", "dflt", True) == "dflt"
    assert list(d) == list("dcab")  # a miss moves nothing


def test_argument_errors():
    d = CUsageOrderedDict()
    with pytest.raises(TypeError, match=r"get\(\) missing required argument 'key' \(pos 1\)"):
        d.get()
    with pytest.raises(TypeError, match=r"get\(\) takes at most 3 arguments \(4 given\)"):
        d.get(1, 2, 3, 4)
    with pytest.raises(TypeError, match=r"Set\(\) got an unexpected keyword argument 'front'"):
        d.Set(1, 2, front=True)
    with pytest.raises(TypeError, match=r"Set\(\) got multiple values for argument 'value'"):
        d.Set(1, 2, value=3)
    with pytest.raises(TypeError):
        d.Set([], 1)  # unhashable key
    assert len(d) == 0


def test_pop_del_and_missing_keys(cls):
    d = filled(cls, [1, 2, 3])
    d.Set((1, 2), "tuple")
    assert d.pop(2) == "v2"
    assert d.pop(2, "gone") == "gone"
    assert 2 not in d and 1 in d and (1, 2) in d
    with pytest.raises(KeyError) as exc:
        d.pop(2)
    assert exc.value.args == (2,)
    del d[(1, 2)]
    for op in (lambda: d[(1, 2)], lambda: d.__delitem__((1, 2)), lambda: d.pop((1, 2))):
        with pytest.raises(KeyError) as exc:
            op()
        assert exc.value.args == ((1, 2),)  # a tuple key is not unpacked
    assert list(d.items()) == [(1, "v1"), (3, "v3")]


def test_first_and_last_entries(cls):
    d = cls()
    val = ["scope"]
    d.Set("x", val)
    d.Set("y", 2)
    first, last = d._fFirst, d._fLast
    assert (first.key, first.val, last.key, last.val) == ("x", val, "y", 2)
    assert first.val is val  # the caller mutates the stored list through it
    d.get("y", None, True)
    assert d._fFirst.key == "y" and d._fLast.key == "x"
    del d["x"], d["y"]
    assert first.key == "x"  # an entry is a snapshot holding its own references
    with pytest.raises(AttributeError):
        d._fFirst = None
    with pytest.raises(AttributeError):
        first.key = "z"
    with pytest.raises(TypeError):
        type(first)()


def test_iteration_views_go_front_to_back(cls):
    d = filled(cls, [3, 1, 2])
    d.Set(0, "v0", first=True)
    assert list(d) == list(d.keys()) == [0, 3, 1, 2]
    assert list(d.values()) == ["v0", "v3", "v1", "v2"]
    assert list(d.items()) == list(d.iteritems()) == [(0, "v0"), (3, "v3"), (1, "v1"), (2, "v2")]
    it = d.items()
    next(it)
    assert it.__length_hint__() == 3


MUTATIONS = {
    "set_new": lambda d: d.Set("new", 0),
    "set_existing_other_end": lambda d: d.Set("a", 0, first=False),
    "del": lambda d: d.__delitem__("c"),
    "pop": lambda d: d.pop("b"),
    "get_first_moves": lambda d: d.get("c", None, True),
    "clear": lambda d: d.clear(),
}


@pytest.mark.parametrize("view", ["iter", "keys", "values", "items"])
@pytest.mark.parametrize("mutate", MUTATIONS.values(), ids=MUTATIONS.keys())
def test_mutation_during_iteration_raises_on_next_step(cls, view, mutate):
    d = filled(cls, "abc")
    it = iter(d) if view == "iter" else getattr(d, view)()
    next(it)
    mutate(d)
    with pytest.raises(RuntimeError) as exc:
        next(it)
    assert str(exc.value) == MUTATED_DURING_ITERATION
    assert list(it) == []  # exhausted afterwards
    check_sound(d)


def test_changes_that_keep_the_order_do_not_disturb_iteration(cls):
    d = filled(cls, "abc")
    it = d.items()
    assert next(it) == ("a", "va")
    d.get("a", None, True)  # already first
    d.Set("c", "new c")  # already last: value replaced in place
    d.get("b")
    assert list(it) == [("b", "vb"), ("c", "new c")]


# ---- reentrancy -------------------------------------------------------------------

class MeddlingKey(Loc):
    """Collides with every other MeddlingKey; __eq__ runs `action` first."""

    def __init__(self, name, action=None):
        super().__init__(name, h=12345)
        self.action = action

    def __eq__(self, other):
        if self.action:
            self.action()
        return super().__eq__(other)

    __hash__ = Loc.__hash__


def test_eq_that_removes_entries_once_restarts_the_lookup(cls):
    d = cls()
    keys = [MeddlingKey(f"k{i}") for i in range(5)]
    for k in keys:
        d.Set(k, k.name)
    fired = []

    def remove_k1_once():
        if not fired:
            fired.append(True)
            del d[keys[1]]

    keys[0].action = remove_k1_once
    probe = MeddlingKey("k3")
    assert d.get(probe, None, True) == "k3"  # found despite the mutation
    assert fired and keys[1] not in d
    assert [k.name for k in d] == ["k3", "k0", "k2", "k4"]
    check_sound(d)


def test_eq_that_always_mutates_gives_up_with_runtime_error(cls):
    d = cls()
    counter = iter(range(10**6))
    stored = MeddlingKey("stored", action=lambda: d.Set(next(counter), None))
    d.Set(stored, 1)
    with pytest.raises(RuntimeError) as exc:
        d.get(MeddlingKey("other"))
    assert str(exc.value) == MUTATED_DURING_LOOKUP
    check_sound(d)


def test_eq_that_clears_or_raises(cls):
    d = cls()
    d.Set(MeddlingKey("a", action=lambda: d.clear()), 1)
    assert d.pop(MeddlingKey("x"), "dflt") == "dflt"
    assert len(d) == 0

    def boom():
        raise ValueError("boom")

    d.Set(MeddlingKey("b", action=boom), 2)
    with pytest.raises(ValueError, match="boom"):
        d.Set(MeddlingKey("c"), 3)
    assert [k.name for k in d] == ["b"]


def test_hash_that_mutates_the_mapping(cls):
    d = cls()

    class HashMeddler:
        def __hash__(self):
            d.Set(len(d), "side effect", first=True)
            return 1

    key = HashMeddler()
    d.Set(key, "k")
    d.Set("z", "z")
    assert d.get(key) == "k"
    assert list(d.values()) == ["side effect", "side effect", "k", "z"]
    assert list(d)[:2] + list(d)[3:] == [3, 0, "z"]  # each hash call added len(d) in front


def test_value_finalizers_that_mutate_the_mapping(cls):
    d = cls()
    log = []

    class Meddler:
        def __init__(self, tag):
            self.tag = tag

        def __del__(self):
            log.append(self.tag)
            d.Set(f"from {self.tag}", None, first=True)

    d.Set("a", Meddler("replaced"))
    d.Set("a", 1)  # the old value's __del__ runs with the new value in place
    d.Set("b", Meddler("popped"))
    d.pop("b")
    d.Set("c", Meddler("deleted"))
    del d["c"]
    assert log == ["replaced", "popped", "deleted"]
    assert list(d) == ["from deleted", "from popped", "from replaced", "a"]
    d.Set("d", Meddler("cleared"))
    d.clear()
    assert list(d.items()) == [("from cleared", None)]


def test_repr_survives_keys_whose_repr_mutates(cls):
    d = cls()

    class LoudKey:
        def __repr__(self):
            d.clear()
            return "LoudKey"

    d.Set(LoudKey(), 1)
    d.Set("b", 2)
    assert repr(d) == f"{cls.__name__}([(LoudKey, 1), ('b', 2)])"
    assert len(d) == 0


# ---- repr, misc -------------------------------------------------------------------

def test_repr(cls):
    d = cls()
    assert repr(d) == f"{cls.__name__}()"
    d.Set("a", 1)
    d.Set(2, [3])
    d.Set("self", d)
    assert repr(d) == f"{cls.__name__}([('a', 1), (2, [3]), ('self', {cls.__name__}(...))])"
    assert repr(d._fFirst) == "CUsageOrderedDictEntry(key='a', val=1)"


def test_repr_of_subclass_goes_through_its_items():
    d = CountingSub()
    d.Set("a", 1)
    repr(d)
    assert d.calls["items"] == 1


def test_unhashable_no_item_assignment_and_wrong_self():
    d = CUsageOrderedDict()
    with pytest.raises(TypeError):
        hash(d)
    with pytest.raises(TypeError) as exc:
        d["k"] = 1
    assert str(exc.value) == NO_ITEM_ASSIGNMENT
    with pytest.raises(TypeError):
        CUsageOrderedDict.get({}, "k")


def test_memory_is_returned_after_bulk_removal():
    d = CUsageOrderedDict()
    empty = sys.getsizeof(d)
    for i in range(10000):
        d.Set(i, None)
    big = sys.getsizeof(d)
    assert big > empty + 10000 * 32
    for i in range(9990):
        del d[i]
    assert sys.getsizeof(d) < big / 20
    assert list(d) == list(range(9990, 10000))


def test_references_are_balanced(cls):
    key, val, other = Loc("k"), ["v"], ["w"]
    base = [sys.getrefcount(x) for x in (key, val, other)]
    for _ in range(100):
        d = cls()
        d.Set(key, val)
        d.Set(key, other, first=True)  # replace
        d.Set(key, val)
        d.get(key, None, True)
        d[key]
        list(d.items()), list(d.values()), list(d), repr(d), d._fFirst, d._fLast
        assert d.pop(key) is val
        d.Set(key, val)
        del d[key]
        d.Set(key, val)
        d.Set("x", other)
        d.clear()
        d.Set(key, val)
        del d  # dealloc drops the last pair
    assert [sys.getrefcount(x) for x in (key, val, other)] == base


# ---- cyclic GC --------------------------------------------------------------------

def collected(make_cycle):
    ref = make_cycle()
    gc.collect()
    return ref() is None


def test_gc_collects_cycles(cls):
    def through_value():
        d = cls()
        d.Set("self", d)
        return weakref.ref(d)

    def through_key():
        d = cls()
        key = Loc("k")
        key.owner = d
        d.Set(key, 1)
        return weakref.ref(d)

    def through_entry_and_iterator():
        d = cls()
        holder = []
        d.Set("holder", holder)
        holder.append(d._fFirst)
        holder.append(d.items())
        return weakref.ref(d)

    def through_instance_dict():
        d = cls()
        d.me = d
        return weakref.ref(d)

    makers = [through_value, through_key, through_entry_and_iterator]
    if cls is not CUsageOrderedDict:  # only subclasses have an instance __dict__
        makers.append(through_instance_dict)
    for make in makers:
        assert collected(make), make.__name__


def test_gc_sees_every_key_and_value():
    d = CUsageOrderedDict()
    keys = [Loc(str(i)) for i in range(50)]
    vals = [[i] for i in range(50)]
    for k, v in zip(keys, vals):
        d.Set(k, v)
    for k in keys[::3]:
        del d[k]  # leaves free entries behind that must not be visited
    referents = gc.get_referents(d)
    expected = [x for pair in d.items() for x in pair]
    assert all(any(x is r for r in referents) for x in expected)
    assert len(referents) == len(expected) + 1  # + the type


def test_deeply_nested_mappings_deallocate():
    outer = CUsageOrderedDict()
    d = outer
    for _ in range(100000):
        inner = CUsageOrderedDict()
        d.Set("inner", inner)
        d = inner
    del d, inner
    ref = weakref.ref(outer)
    del outer
    assert ref() is None


# ---- capsule C API ----------------------------------------------------------------

def _capi():
    PyObj = ctypes.py_object
    vp, ci = ctypes.c_void_p, ctypes.c_int

    class Table(ctypes.Structure):
        _fields_ = [
            ("abi_version", ctypes.c_uint),
            ("type", vp),
            ("create", ctypes.PYFUNCTYPE(vp)),
            ("get", ctypes.PYFUNCTYPE(vp, PyObj, PyObj, ci)),
            ("set", ctypes.PYFUNCTYPE(ci, PyObj, PyObj, PyObj, ci)),
            ("pop", ctypes.PYFUNCTYPE(vp, PyObj, PyObj)),
            ("del_", ctypes.PYFUNCTYPE(ci, PyObj, PyObj)),
            ("size", ctypes.PYFUNCTYPE(ctypes.c_ssize_t, PyObj)),
            ("first", ctypes.PYFUNCTYPE(ci, PyObj, ctypes.POINTER(vp), ctypes.POINTER(vp))),
        ]

    api = ctypes.pythonapi
    api.PyCapsule_GetPointer.restype = vp
    api.PyCapsule_GetPointer.argtypes = [PyObj, ctypes.c_char_p]
    api.Py_DecRef.argtypes = [vp]
    ptr = api.PyCapsule_GetPointer(uodmod._C_API, b"pysource.usageordereddict._C_API")
    return Table.from_address(ptr)


def _obj(ptr):
    return ctypes.cast(ptr, ctypes.py_object).value


def test_capsule_table_matches_the_python_methods():
    capi = _capi()
    assert capi.abi_version == 1
    assert capi.type == id(CUsageOrderedDict)

    p = capi.create()
    d = _obj(p)
    ctypes.pythonapi.Py_DecRef(p)  # create() returned a new reference
    assert type(d) is CUsageOrderedDict and sys.getrefcount(d) == 2

    k = ctypes.c_void_p()
    v = ctypes.c_void_p()
    assert capi.first(d, ctypes.byref(k), ctypes.byref(v)) == 0 and not k.value and not v.value

    val = ["scope"]
    assert capi.set(d, "a", val, 0) == 0
    assert capi.set(d, "b", 2, 1) == 0
    assert list(d) == ["b", "a"] and capi.size(d) == 2

    before = sys.getrefcount(val)
    assert _obj(capi.get(d, "a", 1)) is val  # borrowed: no new reference
    assert sys.getrefcount(val) == before
    assert list(d) == ["a", "b"]
    assert capi.get(d, "missing", 1) is None  # NULL and no exception

    assert capi.first(d, ctypes.byref(k), ctypes.byref(v)) == 0
    assert (_obj(k.value), _obj(v.value)) == ("a", val)

    p = capi.pop(d, "a")
    assert _obj(p) is val
    ctypes.pythonapi.Py_DecRef(p)
    assert sys.getrefcount(val) == before - 1  # the mapping's reference went with it
    assert capi.pop(d, "a") is None
    assert capi.del_(d, "b") == 0
    with pytest.raises(KeyError):
        capi.del_(d, "b")
    with pytest.raises(TypeError):
        capi.get({}, "a", 0)
    with pytest.raises(TypeError):
        capi.set(d, [], 1, 0)
    assert capi.size(d) == 0


# ---- model-based ------------------------------------------------------------------

KEYS = st.one_of(
    st.integers(0, 30),
    st.sampled_from(["a", "b", "loc/x.py", "é", "a" * 40]),
    st.tuples(st.integers(0, 3), st.integers(0, 3)),
    st.builds(Loc, st.sampled_from(["p", "q", "r", "s"]), st.sampled_from([None, 7])),
)


class ModelMachine(RuleBasedStateMachine):
    """The mapping against a list of (key, value) pairs, front first."""

    def __init__(self):
        super().__init__()
        self.d = CUsageOrderedDict()
        self.model = []
        self.serial = 0

    def _find(self, key):
        return next((i for i, (k, _) in enumerate(self.model) if k == key), -1)

    def _put(self, key, value, first):
        i = self._find(key)
        if i >= 0:
            self.model.pop(i)
        self.model.insert(0 if first else len(self.model), (key, value))

    @rule(key=KEYS, first=st.booleans())
    def set(self, key, first):
        self.serial += 1
        self.d.Set(key, self.serial, first=first)
        self._put(key, self.serial, first)

    @rule(key=KEYS, first=st.booleans())
    def get(self, key, first):
        i = self._find(key)
        assert self.d.get(key, "absent", first) == (self.model[i][1] if i >= 0 else "absent")
        if i >= 0 and first:
            self.model.insert(0, self.model.pop(i))

    @rule(key=KEYS, with_default=st.booleans())
    def pop(self, key, with_default):
        i = self._find(key)
        expected = self.model.pop(i)[1] if i >= 0 else "absent"
        if with_default or i >= 0:
            assert self.d.pop(key, "absent") == expected
        else:
            with pytest.raises(KeyError):
                self.d.pop(key)

    @precondition(lambda self: self.model)
    @rule(data=st.data())
    def delete(self, data):
        key = data.draw(st.sampled_from([k for k, _ in self.model]))
        del self.d[key]
        self.model.pop(self._find(key))

    @rule(n=st.integers(1, 300), first=st.booleans())
    def bulk_set(self, n, first):
        base = 1000 + self.serial
        self.serial += n
        for i in range(n):
            self.d.Set(("bulk", base + i), i, first)
            self._put(("bulk", base + i), i, first)

    @rule(keep=st.integers(0, 5))
    def bulk_pop_from_front(self, keep):
        while len(self.model) > keep:
            key, value = self.model.pop(0)
            assert self.d._fFirst.key == key
            assert self.d.pop(key) == value

    @rule()
    def clear(self):
        self.d.clear()
        self.model.clear()

    @invariant()
    def agrees(self):
        assert list(self.d.items()) == self.model
        assert len(self.d) == len(self.model)
        first, last = self.d._fFirst, self.d._fLast
        if self.model:
            assert (first.key, first.val) == self.model[0]
            assert (last.key, last.val) == self.model[-1]
        else:
            assert first is None and last is None


TestModel = ModelMachine.TestCase
TestModel.settings = settings(max_examples=60, stateful_step_count=40, deadline=None)


def test_long_random_run_against_ordered_dict():
    rng = random.Random(20240601)
    d = CUsageOrderedDict()
    model = collections.OrderedDict()
    for step in range(60000):
        # Drift the key range so the table grows, churns and shrinks.
        span = 50 + (step // 2000 % 10) * 400
        key = rng.randrange(span) if rng.random() < 0.8 else Loc(str(rng.randrange(span)))
        roll = rng.random()
        if roll < 0.35:
            first = rng.random() < 0.5
            d.Set(key, step, first)
            model[key] = step
            model.move_to_end(key, last=not first)
        elif roll < 0.55:
            first = rng.random() < 0.5
            assert d.get(key, None, first) == model.get(key)
            if first and key in model:
                model.move_to_end(key, last=False)
        else:
            assert d.pop(key, None) == model.pop(key, None)
        if step % 500 == 0:
            assert list(d.items()) == list(model.items())
    assert list(d.items()) == list(model.items())
