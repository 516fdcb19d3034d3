"""CUsageOrderedDict: order semantics against a model, reentrant keys and values,
the cyclic GC, subclassing (flavours: the class, a bare and a counting subclass)."""
import collections
import gc
import random
import re
import sys
import weakref

import pytest

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


def test_construction_and_arguments():
    d = CUsageOrderedDict()
    assert len(d) == 0 and d._fFirst is None and d._fLast is None
    for args, kwargs in [((1,), {}), ((), {"x": 1})]:
        with pytest.raises(TypeError, match=f"^{re.escape(TAKES_NO_ARGUMENTS)}$"):
            CUsageOrderedDict(*args, **kwargs)

    class WithArgs(CUsageOrderedDict):
        def __init__(self, seed):
            super().__init__()
            self.Set("seed", seed)

    assert list(WithArgs(7).items()) == [("seed", 7)]
    for call, message in [
            (lambda: d.get(), r"get\(\) missing required argument 'key' \(pos 1\)"),
            (lambda: d.get(1, 2, 3, 4), r"get\(\) takes at most 3 arguments \(4 given\)"),
            (lambda: d.Set(1, 2, front=True), r"Set\(\) got an unexpected keyword argument"),
            (lambda: d.Set(1, 2, value=3), r"Set\(\) got multiple values for argument 'value'"),
            (lambda: d.__setitem__("k", 1), f"^{re.escape(NO_ITEM_ASSIGNMENT)}$"),
            (lambda: d.Set([], 1), "unhashable"), (lambda: hash(d), "unhashable"),
            (lambda: CUsageOrderedDict.get({}, "k"), None)]:
        with pytest.raises(TypeError, match=message):
            call()
    d.Set((1, 2), 1)
    del d[(1, 2)]
    with pytest.raises(KeyError) as exc:
        d.pop((1, 2))
    assert exc.value.args == ((1, 2),) and len(d) == 0  # a tuple key is not unpacked


@pytest.mark.parametrize("view", ["iter", "keys", "values", "items"])
@pytest.mark.parametrize("mutate", [
    lambda d: d.Set("new", 0), lambda d: d.Set("a", 0, first=False),
    lambda d: d.__delitem__("c"), lambda d: d.pop("b"), lambda d: d.get("c", None, True),
    lambda d: d.clear()])
def test_mutation_during_iteration_raises_on_next_step(cls, view, mutate):
    d = filled(cls, "abc")
    it = iter(d) if view == "iter" else getattr(d, view)()
    next(it)
    mutate(d)
    with pytest.raises(RuntimeError, match=f"^{MUTATED_DURING_ITERATION}$"):
        next(it)
    assert list(it) == []  # exhausted afterwards
    check_sound(d)


def test_changes_that_keep_the_order_do_not_disturb_iteration(cls):
    d = filled(cls, "abc")
    it = d.items()
    next(it)
    d.get("a", None, True)  # already first
    d.Set("c", "new c")  # already last: the value is replaced in place
    assert list(it) == [("b", "vb"), ("c", "new c")]


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


def test_keys_whose_eq_changes_the_mapping(cls):
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
    assert d.get(MeddlingKey("k3"), None, True) == "k3"  # the lookup restarts
    assert [k.name for k in d] == ["k3", "k0", "k2", "k4"]
    check_sound(d)
    d.clear()
    counter = iter(range(10**6))
    d.Set(MeddlingKey("stored", action=lambda: d.Set(next(counter), None)), 1)
    with pytest.raises(RuntimeError, match=f"^{MUTATED_DURING_LOOKUP}$"):
        d.get(MeddlingKey("other"))  # a key that always mutates: give up
    check_sound(d)
    d.clear()
    d.Set(MeddlingKey("a", action=d.clear), 1)
    assert d.pop(MeddlingKey("x"), "dflt") == "dflt" and len(d) == 0
    d.Set(MeddlingKey("b", action=lambda: 1 / 0), 2)
    with pytest.raises(ZeroDivisionError):
        d.Set(MeddlingKey("c"), 3)
    assert [k.name for k in d] == ["b"]


def test_hashes_and_finalizers_that_change_the_mapping(cls):
    d = cls()

    class HashMeddler:
        def __hash__(self):
            d.Set(len(d), "side effect", first=True)
            return 1

    key = HashMeddler()
    d.Set(key, "k")
    d.Set("z", "z")
    assert d.get(key) == "k"
    assert list(d)[:2] + list(d)[3:] == [3, 0, "z"]  # each hash call added len(d) in front
    d.clear()
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
    assert list(d) == ["from deleted", "from popped", "from replaced", "a"]
    d.Set("d", Meddler("cleared"))
    d.clear()
    assert list(d.items()) == [("from cleared", None)]
    assert log == ["replaced", "popped", "deleted", "cleared"]


def test_repr(cls):
    d = cls()
    assert repr(d) == f"{cls.__name__}()"
    d.Set("a", 1)
    d.Set("self", d)
    assert repr(d) == f"{cls.__name__}([('a', 1), ('self', {cls.__name__}(...))])"
    assert repr(d._fFirst) == "CUsageOrderedDictEntry(key='a', val=1)"
    if cls is CountingSub:
        assert d.calls["items"] == 2  # a subclass's repr goes through its items

    class LoudKey:
        def __repr__(self):
            d.clear()
            return "LoudKey"

    d.clear()
    d.Set(LoudKey(), 1)
    d.Set("b", 2)
    assert repr(d) == f"{cls.__name__}([(LoudKey, 1), ('b', 2)])" and len(d) == 0


def test_memory_is_returned_after_bulk_removal():
    d = CUsageOrderedDict()
    empty = sys.getsizeof(d)
    for i in range(10000):
        d.Set(i, None)
    big = sys.getsizeof(d)
    assert big > empty + 10000 * 32
    for i in range(9990):
        del d[i]
    assert sys.getsizeof(d) < big / 20 and list(d) == list(range(9990, 10000))


def test_gc_collects_cycles(cls):
    def cycle(how):
        d = cls()
        if how == "value":
            d.Set("self", d)
        elif how == "key":
            key = Loc("k")
            key.owner = d
            d.Set(key, 1)
        elif how == "entry and iterator":
            holder = []
            d.Set("holder", holder)
            holder.extend([d._fFirst, d.items()])
        else:
            d.me = d
        return weakref.ref(d)

    hows = ["value", "key", "entry and iterator"] + ["dict"] * (cls is not CUsageOrderedDict)
    refs = [cycle(how) for how in hows]
    gc.collect()
    assert [r() for r in refs] == [None] * len(hows)


def test_deeply_nested_mappings_deallocate():
    outer = d = CUsageOrderedDict()
    for _ in range(100000):
        inner = CUsageOrderedDict()
        d.Set("inner", inner)
        d = inner
    del d, inner
    ref = weakref.ref(outer)
    del outer
    assert ref() is None


def test_random_operations_against_an_ordered_dict():
    """Set, get (moving to the front or not), pop, del and clear against
    collections.OrderedDict; the key range drifts so the table grows, churns and
    shrinks; some keys hash and compare in Python and collide."""
    rng = random.Random(20240601)
    d, model = CUsageOrderedDict(), collections.OrderedDict()
    for step in range(40000):
        span = 50 + (step // 2000 % 10) * 400
        key = rng.randrange(span) if rng.random() < 0.8 else Loc(str(rng.randrange(span)), 7)
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
        elif roll < 0.9997:
            assert d.pop(key, None) == model.pop(key, None)
        else:
            d.clear()
            model.clear()
        if step % 500 == 0:
            assert list(d.items()) == list(d.iteritems()) == list(model.items())
            assert list(d) == list(d.keys()) == list(model) and len(d) == len(model)
            assert list(d.values()) == list(model.values())
            check_sound(d)
    if model:
        key = next(iter(model))
        del d[key], model[key]
    assert list(d.items()) == list(model.items())
