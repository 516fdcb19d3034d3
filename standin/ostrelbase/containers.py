"""Container inspectors: agents that serve the files of a container image.

They behave like remote agents (``remoteclient``) and emit the same
"server-stopped" signal; they are a separate class so that listeners can follow
one kind or the other.
"""
from __future__ import annotations

from ostrelbase import remoteclient


class CContainerInspectorManager(remoteclient.CAgentServerBase):
    """The agent of one container, registered under the container's name."""


def RegisterContainer(name: str, root_dir: str, latency_ms: float = 0
                      ) -> CContainerInspectorManager:
    server = remoteclient.RegisterServer(name, root_dir, latency_ms,
                                         kind=CContainerInspectorManager)
    assert isinstance(server, CContainerInspectorManager)
    return server
