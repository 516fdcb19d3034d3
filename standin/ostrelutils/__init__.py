"""Small utilities shared by the whole application."""
