// <windows.h> as every Windows file of the library and its tests includes it: without the
// rarely used parts of the API (WIN32_LEAN_AND_MEAN) and without the min and max macros
// (NOMINMAX), which would break std::min, std::max and std::numeric_limits<T>::max().
#ifndef KOVPAGER_SUPPORT_WIN32API_H
#define KOVPAGER_SUPPORT_WIN32API_H

#ifndef WIN32_LEAN_AND_MEAN
#define WIN32_LEAN_AND_MEAN
#endif
#ifndef NOMINMAX
#define NOMINMAX
#endif
#include <windows.h>

#endif  // KOVPAGER_SUPPORT_WIN32API_H
