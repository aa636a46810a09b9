// The first operation lands with the library's own source.
