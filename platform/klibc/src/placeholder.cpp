// Placeholder until the library's sources land.
