# Cross build of the EFI programs: clang for the x86-64 firmware target, linked
# by lld-link as PE32+ EFI applications. No libc, no C++ runtime.
set(CMAKE_SYSTEM_NAME Generic)
set(CMAKE_SYSTEM_PROCESSOR x86_64)
set(NIMB_TARGET_EFI ON CACHE BOOL "building the EFI programs" FORCE)

find_program(NIMB_CLANG NAMES clang clang-14 REQUIRED)
find_program(NIMB_CLANGXX NAMES clang++ clang++-14 REQUIRED)
find_program(NIMB_LLD_LINK NAMES lld-link lld-link-14 REQUIRED)

set(CMAKE_C_COMPILER ${NIMB_CLANG})
set(CMAKE_CXX_COMPILER ${NIMB_CLANGXX})
set(CMAKE_ASM_COMPILER ${NIMB_CLANG})
set(CMAKE_LINKER ${NIMB_LLD_LINK})
set(CMAKE_C_COMPILER_TARGET x86_64-unknown-windows)
set(CMAKE_CXX_COMPILER_TARGET x86_64-unknown-windows)
set(CMAKE_ASM_COMPILER_TARGET x86_64-unknown-windows)
set(CMAKE_TRY_COMPILE_TARGET_TYPE STATIC_LIBRARY)

set(NIMB_EFI_FLAGS "--target=x86_64-unknown-windows -ffreestanding -fno-builtin -mno-red-zone -fno-stack-protector -fshort-wchar -mno-stack-arg-probe -fno-asynchronous-unwind-tables -mno-sse -mno-mmx -msoft-float -fno-jump-tables")
set(CMAKE_C_FLAGS_INIT "${NIMB_EFI_FLAGS}")
set(CMAKE_CXX_FLAGS_INIT "${NIMB_EFI_FLAGS} -fno-exceptions -fno-rtti -fno-threadsafe-statics")
set(CMAKE_ASM_FLAGS_INIT "--target=x86_64-unknown-windows")

set(CMAKE_C_LINK_EXECUTABLE
    "<CMAKE_LINKER> /nologo /subsystem:efi_application /nodefaultlib /machine:x64 <LINK_FLAGS> <OBJECTS> <LINK_LIBRARIES> /out:<TARGET>")
set(CMAKE_CXX_LINK_EXECUTABLE "${CMAKE_C_LINK_EXECUTABLE}")
set(CMAKE_EXECUTABLE_SUFFIX .efi)
set(CMAKE_STATIC_LIBRARY_SUFFIX .lib)
set(CMAKE_STATIC_LIBRARY_PREFIX "")
