"""GUI toolkit wrappers: the main loop with idle and timeout sources."""
