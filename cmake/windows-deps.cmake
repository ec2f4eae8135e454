# What Debian doesn't ship built for mingw, built here once and kept in the
# build folder: Boost.Filesystem's compiled part from the source package of
# the release's Boost (boost1.81 on Debian 12, boost1.83 on 13), and GoogleTest
# from /usr/src/googletest. Boost's headers are that release's own, seen
# through TORVAD_BOOST_WINDOWS/include, which holds only boost/.
set(TORVAD_BOOST_WINDOWS "" CACHE PATH
    "Folder with include/boost and Boost.Filesystem's src/ (make windows fills it)")
if(NOT EXISTS "${TORVAD_BOOST_WINDOWS}/include/boost/version.hpp"
   OR NOT EXISTS "${TORVAD_BOOST_WINDOWS}/filesystem/src/operations.cpp")
  message(FATAL_ERROR "TORVAD_BOOST_WINDOWS must hold include/boost and filesystem/src: use make windows")
endif()

# Windows 10 as the oldest target; windows.h without the parts that clash
# with Asio's own winsock2.h, and without min and max as macros.
add_compile_definitions(_WIN32_WINNT=0x0A00 WIN32_LEAN_AND_MEAN NOMINMAX)

add_library(boost_headers INTERFACE)
target_include_directories(boost_headers SYSTEM INTERFACE "${TORVAD_BOOST_WINDOWS}/include")
# Asio's sockets and completion ports.
target_link_libraries(boost_headers INTERFACE ws2_32 mswsock)
add_library(Boost::headers ALIAS boost_headers)

# The sources and defines of Boost's own build of the library for Windows.
set(filesystem_src "${TORVAD_BOOST_WINDOWS}/filesystem/src")
add_library(boost_filesystem STATIC
  ${filesystem_src}/codecvt_error_category.cpp ${filesystem_src}/directory.cpp
  ${filesystem_src}/exception.cpp ${filesystem_src}/operations.cpp ${filesystem_src}/path.cpp
  ${filesystem_src}/path_traits.cpp ${filesystem_src}/portability.cpp
  ${filesystem_src}/unique_path.cpp ${filesystem_src}/utf8_codecvt_facet.cpp
  ${filesystem_src}/windows_file_codecvt.cpp)
target_compile_definitions(boost_filesystem
  PRIVATE BOOST_FILESYSTEM_SOURCE BOOST_USE_WINDOWS_H BOOST_FILESYSTEM_HAS_BCRYPT
          BOOST_FILESYSTEM_HAS_INIT_PRIORITY
  PUBLIC BOOST_FILESYSTEM_STATIC_LINK=1 BOOST_ALL_NO_LIB)
target_include_directories(boost_filesystem PRIVATE ${filesystem_src})
# Not our code: its warnings are not ours to fail on.
target_compile_options(boost_filesystem PRIVATE -w)
target_link_libraries(boost_filesystem PUBLIC boost_headers bcrypt)
add_library(Boost::filesystem ALIAS boost_filesystem)

if(NOT TORVAD_SANITIZE AND NOT TORVAD_FUZZ)
  set(INSTALL_GTEST OFF CACHE BOOL "" FORCE)
  set(BUILD_GMOCK OFF CACHE BOOL "" FORCE)
  add_subdirectory(/usr/src/googletest ${CMAKE_BINARY_DIR}/googletest EXCLUDE_FROM_ALL)
  foreach(gtest_target gtest gtest_main)
    target_compile_options(${gtest_target} PRIVATE -w)
  endforeach()
endif()
