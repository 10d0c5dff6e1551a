// The shared library is made of the internal static library, linked whole;
// this translation unit only gives the target a source of its own.
