"""Micro-benchmark of CUsageOrderedDict against a plain dict, same keys, same run.

    ./run bench uod [--sizes 1000,10000,100000] [--repeat 9] [--keys str|loc]

Three tables:
  1. Through the C API: the capsule's functions, called by C code exactly as a
     consuming extension does, against the nearest PyDict calls
     (pysource.usageordereddict._bench_capi times one pass of each).
  2. Through Python method calls: d.get(k), d.Set(k, v, first=True), ...
     against dict.get, d[k] = v, dict.pop, del d[k].
  3. Memory: bytes allocated per entry (tracemalloc) beyond the key and value
     objects, for 100,000 entries.
Every figure is the median over --repeat runs, in nanoseconds per operation.
"Probe order" is the order the timed pass visits the keys: the order they
were stored in, or shuffled (scattered memory accesses on large tables).
"""
import argparse
import gc
import random
import statistics
import sys
import tracemalloc
from time import perf_counter_ns

from pysource import usageordereddict as uodmod

CUsageOrderedDict = uodmod.CUsageOrderedDict

CAPI_OPS = [
    ("get", "get(k)", "PyDict_GetItemWithError"),
    ("get_first", "get(k, first=1)", "PyDict_GetItemWithError"),
    ("set_front", "Set(k, v, 1) present", "PyDict_SetItem present"),
    ("set_back", "Set(k, v, 0) present", "PyDict_SetItem present"),
    ("insert_front", "Set(k, v, 1) new", "PyDict_SetItem new"),
    ("insert_back", "Set(k, v, 0) new", "PyDict_SetItem new"),
    ("pop", "pop(k)", "_PyDict_Pop"),
    ("del", "del(k)", "PyDict_DelItem"),
]


class Loc:
    """Stands for the host's location objects: __hash__ and __eq__ in Python."""

    __slots__ = ("_hash", "url")

    def __init__(self, url):
        self.url = url
        self._hash = hash(url)

    def __hash__(self):
        return self._hash

    def __eq__(self, other):
        return self is other or (type(other) is Loc and other.url == self.url)


def make_keys(n, kind):
    urls = [f"file:///home/user/project/pkg{i % 97}/module_{i}.py" for i in range(n)]
    return urls if kind == "str" else [Loc(u) for u in urls]


# ---- Python-level passes: each returns ns for one pass over `keys` ---------------

def _timed(fn, *args):
    gc.disable()
    try:
        t = perf_counter_ns()
        fn(*args)
        return perf_counter_ns() - t
    finally:
        gc.enable()


def py_get(d, keys, _v):
    get = d.get
    for k in keys:
        get(k)


def py_get_first(d, keys, _v):
    get = d.get
    for k in keys:
        get(k, None, True)


def py_set_front(d, keys, v):
    put = d.Set
    for k in keys:
        put(k, v, first=True)


def py_set_back(d, keys, v):
    put = d.Set
    for k in keys:
        put(k, v)


def py_pop(d, keys, _v):
    pop = d.pop
    for k in keys:
        pop(k)


def py_del(d, keys, _v):
    for k in keys:
        del d[k]


def dict_get(d, keys, _v):
    get = d.get
    for k in keys:
        get(k)


def dict_set(d, keys, v):
    for k in keys:
        d[k] = v


PY_OPS = [
    ("get(k)", py_get, "d.get(k)", dict_get),
    ("get(k, None, True)", py_get_first, "d.get(k)", dict_get),
    ("Set(k, v, first=True)", py_set_front, "d[k] = v", dict_set),
    ("Set(k, v)", py_set_back, "d[k] = v", dict_set),
    ("pop(k)", py_pop, "d.pop(k)", py_pop),
    ("del d[k]", py_del, "del d[k]", py_del),
]


def fill_uod(keys, values):
    d = CUsageOrderedDict()
    for k, v in zip(keys, values):
        d.Set(k, v)
    return d


def fill_dict(keys, values):
    return dict(zip(keys, values))


# ---- tables ------------------------------------------------------------------------

def header(title, left, right):
    print(f"\n{title}")
    print(f"  {'size':>7} {'probe order':<11} {left:<24} {'ns':>7}   {right:<24} {'ns':>7}  ratio")


def row(n, order, left, a, right, b):
    print(f"  {n:>7} {order:<11} {left:<24} {a:7.1f}   {right:<24} {b:7.1f}  {a / b:5.2f}")


def bench_capi(sizes, repeat, kind, rng):
    header("C API (capsule functions vs PyDict calls)", "CUsageOrderedDict", "dict")
    for n in sizes:
        keys = make_keys(n, kind)
        values = [[f"scope{i}"] for i in range(n)]
        for order in ("stored", "shuffled"):
            probe = keys[:]
            if order == "shuffled":
                rng.shuffle(probe)
            for op, left, right in CAPI_OPS:
                runs = [uodmod._bench_capi(op, keys, values, probe, i % 2 == 1)
                        for i in range(repeat)]
                ours = statistics.median(r[0] for r in runs)
                theirs = statistics.median(r[1] for r in runs)
                row(n, order, left, ours, right, theirs)


def bench_python(sizes, repeat, kind, rng):
    header("Python method calls", "CUsageOrderedDict", "dict")
    for n in sizes:
        keys = make_keys(n, kind)
        values = [[f"scope{i}"] for i in range(n)]
        probe = keys[:]
        rng.shuffle(probe)
        for left, ours_fn, right, dict_fn in PY_OPS:
            ours, theirs = [], []
            for i in range(repeat):
                d, p = fill_uod(keys, values), fill_dict(keys, values)
                if i % 2:
                    theirs.append(_timed(dict_fn, p, probe, values[0]))
                    ours.append(_timed(ours_fn, d, probe, values[0]))
                else:
                    ours.append(_timed(ours_fn, d, probe, values[0]))
                    theirs.append(_timed(dict_fn, p, probe, values[0]))
            row(n, "shuffled", left, statistics.median(ours) / n, right,
                statistics.median(theirs) / n)


def traced_bytes(build, keys, values):
    gc.collect()
    tracemalloc.start()
    try:
        before = tracemalloc.get_traced_memory()[0]
        obj = build(keys, values)
        after = tracemalloc.get_traced_memory()[0]
    finally:
        tracemalloc.stop()
    return after - before, obj


def bench_memory(kind, repeat):
    n = 100_000
    keys = make_keys(n, kind)
    values = [[i] for i in range(n)]
    print(f"\nMemory for {n} entries (tracemalloc, beyond the key and value objects)")
    for name, build in (("CUsageOrderedDict", fill_uod), ("dict", fill_dict)):
        sizes = []
        for _ in range(max(1, repeat // 3)):
            size, obj = traced_bytes(build, keys, values)
            sizes.append(size)
            del obj
        size = statistics.median_low(sizes)
        print(f"  {name:<18} {size:>10} bytes  {size / n:6.1f} bytes/entry"
              f"   (sys.getsizeof {sys.getsizeof(build(keys, values))})")


def main(argv):
    ap = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    ap.add_argument("--sizes", default="1000,10000,100000",
                    help="comma-separated entry counts (default: %(default)s)")
    ap.add_argument("--repeat", type=int, default=9, help="runs per figure (default: 9)")
    ap.add_argument("--keys", choices=["str", "loc"], default="str",
                    help="str: path strings; loc: objects with Python __hash__/__eq__")
    ap.add_argument("--seed", type=int, default=1)
    args = ap.parse_args(argv)
    sizes = [int(s) for s in args.sizes.split(",")]
    rng = random.Random(args.seed)
    print(f"CUsageOrderedDict vs dict; keys={args.keys}; median of {args.repeat} runs; "
          f"Python {sys.version.split()[0]}")
    bench_capi(sizes, args.repeat, args.keys, rng)
    bench_python(sizes, args.repeat, args.keys, rng)
    bench_memory(args.keys, args.repeat)


if __name__ == "__main__":
    main(sys.argv[1:])
