// Keeps the library non-empty while its folder is being filled.
