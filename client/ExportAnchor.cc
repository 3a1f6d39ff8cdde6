// The shared library is made of the static one; a target needs a source of its own.
