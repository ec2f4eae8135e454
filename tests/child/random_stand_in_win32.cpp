// bcrypt.dll beside a copy of torvad.exe, which makes its pipe names known to a
// test's squatter: the n-th call fills its buffer with the byte n.
#include <windows.h>

#include <cstring>

extern "C" __declspec(dllexport) LONG WINAPI
    BCryptGenRandom(void*, unsigned char* buffer, ULONG size, ULONG) {
    static unsigned char calls = 0;
    std::memset(buffer, calls++, size);
    return 0;
}
