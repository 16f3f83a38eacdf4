// Symbol export of the silvan library: hidden by default, exported where marked.
#pragma once

#if defined(_WIN32)
#if defined(SILVAN_BUILDING)
#define SILVAN_API __declspec(dllexport)
#else
#define SILVAN_API __declspec(dllimport)
#endif
#else
#define SILVAN_API __attribute__((visibility("default")))
#endif
