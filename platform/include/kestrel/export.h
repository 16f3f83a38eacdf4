// Symbol export of the platform library: hidden by default, exported where marked.
#pragma once

#if defined(_WIN32)
#if defined(KESTREL_PLATFORM_BUILDING)
#define KESTREL_API __declspec(dllexport)
#else
#define KESTREL_API __declspec(dllimport)
#endif
#else
#define KESTREL_API __attribute__((visibility("default")))
#endif
