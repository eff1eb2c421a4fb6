// Keeps the fakes library non-empty.
