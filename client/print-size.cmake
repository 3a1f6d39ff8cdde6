# Prints the size of the stripped library and leaves nothing behind: cmake -DFILE=... -P print-size.cmake
file(SIZE ${FILE} size)
file(REMOVE ${FILE})
math(EXPR kibibytes "(${size} + 512) / 1024")
message("libvelkreporting.so.8: ${kibibytes} KiB stripped")
