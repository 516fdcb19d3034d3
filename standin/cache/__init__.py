"""Text buffers and the application's cache, savable, file attribute and preference managers."""
