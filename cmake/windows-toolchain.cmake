# Cross-builds the Windows programs on Debian with mingw-w64 (the posix thread
# model, which std::thread needs). The test programs run under Wine.
set(CMAKE_SYSTEM_NAME Windows)
set(CMAKE_SYSTEM_PROCESSOR x86_64)
set(CMAKE_C_COMPILER x86_64-w64-mingw32-gcc-posix)
set(CMAKE_CXX_COMPILER x86_64-w64-mingw32-g++-posix)
set(CMAKE_RC_COMPILER x86_64-w64-mingw32-windres)

# Libraries and headers come from the mingw tree only: /usr/include holds the
# Linux C library's headers, which must never reach this compiler. Boost is
# seen through a folder that holds nothing but boost/ (see windows-deps.cmake).
set(CMAKE_FIND_ROOT_PATH /usr/x86_64-w64-mingw32)
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)

# The C++ runtime, libgcc and winpthread linked in, so that each .exe runs by
# itself, under Wine as on a machine without mingw's DLLs.
set(CMAKE_EXE_LINKER_FLAGS_INIT "-static")

# ctest runs the test programs through Wine; the prefix and WINEDEBUG come
# from the environment that `make test-windows` sets.
set(CMAKE_CROSSCOMPILING_EMULATOR wine)
