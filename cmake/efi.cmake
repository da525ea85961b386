# The EFI programs: the loader and the platform layer.

# clang for this target looks like a compiler of another family to CMake,
# which then writes no header dependencies: ask for them as for gcc.
foreach(lang C CXX ASM)
  set(CMAKE_${lang}_DEPFILE_FORMAT gcc)
  set(CMAKE_DEPFILE_FLAGS_${lang} "-MD -MT <DEP_TARGET> -MF <DEP_FILE>")
  set(CMAKE_${lang}_DEPENDS_USE_COMPILER TRUE)
endforeach()
add_compile_options(-Wall -Wextra -Werror=return-type -Os -ffunction-sections -fdata-sections)
include_directories(${CMAKE_SOURCE_DIR}/src)

add_executable(nimbboot ${NIMB_LOADER_SOURCES})
set_target_properties(nimbboot PROPERTIES SUFFIX .efi)
target_link_options(nimbboot PRIVATE /entry:BootEntry /opt:ref /opt:icf)

file(GLOB NIMB_PLATFORM_SOURCES CONFIGURE_DEPENDS ${CMAKE_SOURCE_DIR}/platform/*.cpp ${CMAKE_SOURCE_DIR}/platform/*.S)
if(NIMB_PLATFORM_SOURCES)
  # The platform layer shares only the string routines and the compiler's C
  # symbols with the loader.
  add_executable(platform ${NIMB_PLATFORM_SOURCES} ${CMAKE_SOURCE_DIR}/src/support/crt_efi.cpp
                          ${CMAKE_SOURCE_DIR}/src/support/strings.cpp)
  set_target_properties(platform PROPERTIES OUTPUT_NAME BOOTX64 SUFFIX .efi)
  target_link_options(platform PRIVATE /entry:PlatformEntry /opt:ref)
endif()
