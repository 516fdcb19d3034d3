"""Build-time configuration of the host application.

``kAvailRemoteSupport``: remote agents and container inspectors are available
(``ostrelbase.remoteclient``, ``ostrelbase.containers``), so components that follow
their "server-stopped" signals should connect to them.
"""

kAvailRemoteSupport = True

# File name of the analysis database inside a project's settings directory.
kAnalysisDatabaseName = 'scopeinfo.sqlite'
