// The crash report writer is linked into the executable; it installs itself before main.
