"""Editor documents and the GUI manager that tracks them."""
