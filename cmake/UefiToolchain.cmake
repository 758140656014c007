# Toolchain for the firmware image: clang for the x86-64 Windows GNU target
# (PE/COFF objects and the Microsoft x64 calling convention, which is the
# firmware's), linked by lld-link. Use it with -DCIFSDRV_PLATFORM=Uefi:
#
#   cmake -S . -B build/efi -G Ninja -DCIFSDRV_PLATFORM=Uefi \
#         -DCMAKE_TOOLCHAIN_FILE=$PWD/cmake/UefiToolchain.cmake
#
# Nothing is linked by CMake itself: the compiler checks build static
# libraries only, and the image is linked by Platform/Uefi/Image.cmake.
set(CMAKE_SYSTEM_NAME Generic)
set(CMAKE_SYSTEM_PROCESSOR x86_64)

set(UEFI_TARGET_TRIPLE x86_64-unknown-windows-gnu)

find_program(UEFI_CLANG NAMES clang clang-16 clang-15 clang-14 REQUIRED)
find_program(UEFI_CLANGXX NAMES clang++ clang++-16 clang++-15 clang++-14 REQUIRED)
set(CMAKE_C_COMPILER ${UEFI_CLANG})
set(CMAKE_CXX_COMPILER ${UEFI_CLANGXX})
set(CMAKE_C_COMPILER_TARGET ${UEFI_TARGET_TRIPLE})
set(CMAKE_CXX_COMPILER_TARGET ${UEFI_TARGET_TRIPLE})

# The compiler checks must not try to link a program for a target that has
# no C library.
set(CMAKE_TRY_COMPILE_TARGET_TYPE STATIC_LIBRARY)

find_program(UEFI_LLD_LINK NAMES lld-link lld-link-16 lld-link-15 lld-link-14 REQUIRED)
find_program(UEFI_LLVM_READOBJ NAMES llvm-readobj llvm-readobj-16 llvm-readobj-15 llvm-readobj-14
             REQUIRED)

# Nothing from the build machine's libraries or headers belongs in the image.
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)
