"""Mime types the application knows about."""

kPythonMimeType = 'text/x-python'
kCythonMimeType = 'text/x-cython'
kPlainTextMimeType = 'text/plain'

# The mime types whose files the analysis engine scans.
kAnalyzableMimeTypes = frozenset({kPythonMimeType})
