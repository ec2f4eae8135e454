// Stands in for bcrypt.dll beside a copy of torvad.exe, so that a test knows
// the names of torvad's pipes before they are made, as a squatter would have
// to: the n-th call fills its buffer with the byte n.
#include <windows.h>

#include <cstring>

namespace {
unsigned char calls = 0;
}

extern "C" __declspec(dllexport) LONG WINAPI
    BCryptGenRandom(void*, unsigned char* buffer, ULONG size, ULONG) {
    std::memset(buffer, calls++, size);
    return 0;
}
