// Symbol visibility for the shared library. Everything is hidden unless
// marked: only the public classes and the few free functions users call.
#pragma once

#if defined(VARDEL_BUILDING_LIBRARY) || defined(VARDEL_STATIC)
#define VARDEL_API __attribute__((visibility("default")))
#else
#define VARDEL_API __attribute__((visibility("default")))
#endif  // VARDEL_BUILDING_LIBRARY || VARDEL_STATIC
