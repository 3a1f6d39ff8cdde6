// Marks what users of the shared library may link; everything else of it stays inside.
#pragma once

#define VELK_EXPORT __attribute__((visibility("default")))
