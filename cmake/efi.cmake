# The EFI programs: the loader and the platform layer.
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
