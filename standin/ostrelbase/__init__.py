"""The host's base package.  The compiled destroyable module may live in another
directory of sys.path; extend_path joins it to this package."""
import pkgutil

__path__ = pkgutil.extend_path(__path__, __name__)
