# The host build: the loader's sources as a library over hostfw/, with the
# unit tests, fuzz targets, tools and benchmarks; the EFI programs come from
# a nested build with the EFI toolchain; the QEMU scenarios boot them.
include(CTest)
include(ExternalProject)

option(NIMB_SANITIZE "build the host code with AddressSanitizer and UndefinedBehaviorSanitizer" ON)
option(NIMB_FUZZ "build the libFuzzer targets (needs clang)" OFF)
option(NIMB_QEMU_TESTS "register the QEMU scenarios with ctest" ON)
option(NIMB_BENCH "build the benchmarks" OFF)

set(CMAKE_POSITION_INDEPENDENT_CODE ON)
add_compile_options(-Wall -Wextra -Werror=return-type -g)
if(NIMB_SANITIZE)
  add_compile_options(-fsanitize=address,undefined -fno-sanitize-recover=undefined -fno-omit-frame-pointer)
  add_link_options(-fsanitize=address,undefined)
endif()
# Host programs load at high addresses so that the arena of hostfw, which
# stands for physical memory below 1 GiB, is free.
add_link_options(-pie)

# --- the host firmware -----------------------------------------------------
file(GLOB HOSTFW_SOURCES CONFIGURE_DEPENDS ${CMAKE_SOURCE_DIR}/hostfw/*.cpp)
add_library(hostfw STATIC ${HOSTFW_SOURCES})
target_include_directories(hostfw PUBLIC ${CMAKE_SOURCE_DIR}/src ${CMAKE_SOURCE_DIR})

# --- the loader's code, compiled for the host ------------------------------
add_library(nimbcore STATIC ${NIMB_LOADER_HOST_SOURCES})
target_include_directories(nimbcore PUBLIC ${CMAKE_SOURCE_DIR}/src)
target_compile_options(nimbcore PRIVATE -fno-exceptions -fno-rtti)
target_link_libraries(nimbcore PUBLIC hostfw)

# --- unit tests ----------------------------------------------------------------
find_package(GTest REQUIRED)
find_package(OpenSSL REQUIRED)
file(GLOB NIMB_UNIT_TESTS CONFIGURE_DEPENDS ${CMAKE_SOURCE_DIR}/tests/unit/*.cpp)
add_executable(unit_tests ${NIMB_UNIT_TESTS})
# OpenSSL is the reference that the loader's AES is checked against.
target_link_libraries(unit_tests PRIVATE nimbcore hostfw GTest::gtest GTest::gtest_main OpenSSL::Crypto)
include(GoogleTest)
gtest_discover_tests(unit_tests DISCOVERY_MODE PRE_TEST PROPERTIES LABELS unit)

# --- fuzz targets --------------------------------------------------------------
# The loader's code is compiled once more with coverage instrumentation, so
# that libFuzzer sees the paths it takes through it.
if(NIMB_FUZZ)
  add_library(nimbcore_fuzz STATIC ${NIMB_LOADER_HOST_SOURCES})
  target_include_directories(nimbcore_fuzz PUBLIC ${CMAKE_SOURCE_DIR}/src)
  target_compile_options(nimbcore_fuzz PRIVATE -fno-exceptions -fno-rtti -fsanitize=fuzzer-no-link)
  target_link_libraries(nimbcore_fuzz PUBLIC hostfw)
  file(GLOB NIMB_FUZZERS CONFIGURE_DEPENDS ${CMAKE_SOURCE_DIR}/tests/fuzz/*.cpp)
  foreach(src ${NIMB_FUZZERS})
    get_filename_component(name ${src} NAME_WE)
    add_executable(fuzz_${name} ${src})
    target_compile_options(fuzz_${name} PRIVATE -fsanitize=fuzzer)
    target_link_options(fuzz_${name} PRIVATE -fsanitize=fuzzer)
    target_link_libraries(fuzz_${name} PRIVATE nimbcore_fuzz hostfw)
    if(name STREQUAL "platform_layer_fuzz")
      # The platform layer's own readers, built for the host as its tests build them.
      set(platform_sources config file_times machine firmware format)
      list(TRANSFORM platform_sources REPLACE "(.+)" "${CMAKE_SOURCE_DIR}/platform/\\1.cpp")
      target_sources(fuzz_${name} PRIVATE ${platform_sources})
      target_include_directories(fuzz_${name} PRIVATE ${CMAKE_SOURCE_DIR})
    endif()
    # A short run in every test pass, from the checked-in seeds; what it
    # finds new goes to the build tree, never to the sources.
    string(REGEX REPLACE "_fuzz$" "" corpus ${name})
    set(work ${CMAKE_BINARY_DIR}/fuzz-corpus/${corpus})
    file(MAKE_DIRECTORY ${work})
    set(seeds)
    if(EXISTS ${CMAKE_SOURCE_DIR}/tests/fuzz/corpus/${corpus})
      set(seeds ${CMAKE_SOURCE_DIR}/tests/fuzz/corpus/${corpus})
    endif()
    add_test(NAME fuzz.${corpus} COMMAND fuzz_${name} -max_total_time=6 -timeout=10 -rss_limit_mb=4096 ${work} ${seeds})
    set_tests_properties(fuzz.${corpus} PROPERTIES LABELS fuzz TIMEOUT 120)
  endforeach()
endif()

# --- host tools ------------------------------------------------------------------
if(EXISTS ${CMAKE_SOURCE_DIR}/tools/CMakeLists.txt)
  add_subdirectory(tools)
endif()
# The reference kernel, after the tools: it is converted with kobj.
if(EXISTS ${CMAKE_SOURCE_DIR}/tests/guest/CMakeLists.txt)
  add_subdirectory(tests/guest)
endif()

# --- benchmarks ------------------------------------------------------------------
if(NIMB_BENCH AND EXISTS ${CMAKE_SOURCE_DIR}/bench/CMakeLists.txt)
  add_subdirectory(bench)
endif()

# --- the EFI programs, built with their own toolchain -------------------------------
set(NIMB_EFI_DIR ${CMAKE_BINARY_DIR}/efi)
ExternalProject_Add(efi
  SOURCE_DIR ${CMAKE_SOURCE_DIR}
  BINARY_DIR ${NIMB_EFI_DIR}
  CMAKE_ARGS -DCMAKE_TOOLCHAIN_FILE=${CMAKE_SOURCE_DIR}/cmake/efi-toolchain.cmake
             -DCMAKE_BUILD_TYPE=Release
  BUILD_ALWAYS ON
  INSTALL_COMMAND ""
  BUILD_BYPRODUCTS ${NIMB_EFI_DIR}/nimbboot.efi ${NIMB_EFI_DIR}/BOOTX64.efi)

# --- the call gate's image needs no relocation in either build ------------------------
find_program(NIMB_OBJDUMP NAMES llvm-objdump llvm-objdump-14)
if(NIMB_OBJDUMP)
  add_test(NAME gate.no-relocations
           COMMAND ${CMAKE_COMMAND} -DOBJDUMP=${NIMB_OBJDUMP}
                   "-DOBJECTS=${CMAKE_BINARY_DIR}/CMakeFiles/nimbcore.dir/src/boot/gate.S.o;${NIMB_EFI_DIR}/CMakeFiles/nimbboot.dir/src/boot/gate.S.obj"
                   -P ${CMAKE_SOURCE_DIR}/cmake/check-gate.cmake)
  set_tests_properties(gate.no-relocations PROPERTIES LABELS unit)
  add_test(NAME efi.sse-only-in-aes
           COMMAND ${CMAKE_COMMAND} -DOBJDUMP=${NIMB_OBJDUMP} -DOBJECT_DIR=${NIMB_EFI_DIR}/CMakeFiles/nimbboot.dir
                   -P ${CMAKE_SOURCE_DIR}/cmake/check-sse.cmake)
  set_tests_properties(efi.sse-only-in-aes PROPERTIES LABELS unit)
endif()

# --- QEMU scenarios ------------------------------------------------------------------
if(NIMB_QEMU_TESTS AND EXISTS ${CMAKE_SOURCE_DIR}/tests/qemu/CMakeLists.txt)
  add_subdirectory(tests/qemu)
endif()
