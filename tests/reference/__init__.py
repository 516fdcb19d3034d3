"""Pure-Python models of compiled classes, used by the tests and the benchmarks."""
