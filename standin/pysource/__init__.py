"""The analysis engine's package.  Compiled modules (scancoordinator, usageordereddict)
may live in another directory of sys.path; extend_path joins them to this package."""
import pkgutil

__path__ = pkgutil.extend_path(__path__, __name__)
