# The firmware image ${CMAKE_BINARY_DIR}/CIFSDrv.efi: every application source
# and the UEFI platform sources, compiled freestanding for the Microsoft x64
# ABI, linked by lld-link as an EFI application with the entry EfiMain.
#
# Included by the top-level CMakeLists.txt when CIFSDRV_PLATFORM is Uefi; the
# toolchain is cmake/UefiToolchain.cmake.
if(NOT CMAKE_CXX_COMPILER_TARGET MATCHES "windows")
  message(FATAL_ERROR "The firmware image needs -DCMAKE_TOOLCHAIN_FILE=<source>/cmake/UefiToolchain.cmake")
endif()

set(UEFI_PLATFORM_DIR ${CMAKE_SOURCE_DIR}/Platform/Uefi)
file(GLOB UEFI_PLATFORM_SOURCES CONFIGURE_DEPENDS ${UEFI_PLATFORM_DIR}/*.cpp)

# Code generation shared by every object of the image: no C library, no
# compiler-inserted calls into one (the image's own memcpy/memset/memmove/
# memcmp are the only ones), no red zone (firmware interrupt handlers run on
# the same stack), no stack probes and no stack protector, whose helpers do
# not exist here.
set(UEFI_CODEGEN_FLAGS
    -ffreestanding
    -nostdlibinc
    -fno-builtin
    -mno-red-zone
    -fno-stack-protector
    -mno-stack-arg-probe
    -O2)

# --- C++: the application and the platform -------------------------------
add_library(cifsdrv_image_objects OBJECT ${APP_SOURCES} ${UEFI_PLATFORM_SOURCES})
target_include_directories(cifsdrv_image_objects PRIVATE ${APP_INCLUDE_DIRS})
target_compile_options(cifsdrv_image_objects PRIVATE ${UEFI_CODEGEN_FLAGS} ${APP_FLAGS})
set(UEFI_IMAGE_OBJECTS $<TARGET_OBJECTS:cifsdrv_image_objects>)

# --- C: third-party sources built into the image -------------------------
# Add C files (for instance the digest and cipher sources the crypto facade
# will use) to UEFI_C_SOURCES, their include directories to
# UEFI_C_INCLUDE_DIRS and their configuration to UEFI_C_DEFINITIONS. They get
# the same code generation but not the project's warning policy.
set(UEFI_C_SOURCES "")
set(UEFI_C_INCLUDE_DIRS "")
set(UEFI_C_DEFINITIONS "")
if(UEFI_C_SOURCES)
  add_library(cifsdrv_image_c_objects OBJECT ${UEFI_C_SOURCES})
  target_include_directories(cifsdrv_image_c_objects PRIVATE ${UEFI_C_INCLUDE_DIRS})
  target_compile_definitions(cifsdrv_image_c_objects PRIVATE ${UEFI_C_DEFINITIONS})
  target_compile_options(cifsdrv_image_c_objects PRIVATE ${UEFI_CODEGEN_FLAGS} -std=c11)
  list(APPEND UEFI_IMAGE_OBJECTS $<TARGET_OBJECTS:cifsdrv_image_c_objects>)
endif()

# --- Link and check --------------------------------------------------------
# The object list goes through a response file, which the post-link check
# reads as well.
set(CIFSDRV_EFI ${CMAKE_BINARY_DIR}/CIFSDrv.efi)
set(CIFSDRV_MAP ${CMAKE_BINARY_DIR}/CIFSDrv.map)
set(CIFSDRV_RSP ${CMAKE_BINARY_DIR}/CIFSDrv.objects.rsp)
file(GENERATE OUTPUT ${CIFSDRV_RSP} CONTENT "\"$<JOIN:${UEFI_IMAGE_OBJECTS},\"\n\">\"\n")
add_custom_command(
  OUTPUT ${CIFSDRV_EFI}
  COMMAND ${CMAKE_COMMAND} -E remove -f ${CIFSDRV_EFI}
  COMMAND ${UEFI_LLD_LINK} /nologo /machine:x64 /subsystem:efi_application /entry:EfiMain
          /nodefaultlib /map:${CIFSDRV_MAP} /out:${CIFSDRV_EFI} @${CIFSDRV_RSP}
  COMMAND ${CMAKE_COMMAND} -DREADOBJ=${UEFI_LLVM_READOBJ} -DIMAGE=${CIFSDRV_EFI}
          -DOBJECT_LIST=${CIFSDRV_RSP} -P ${UEFI_PLATFORM_DIR}/CheckImage.cmake
  DEPENDS ${UEFI_IMAGE_OBJECTS} ${CIFSDRV_RSP} ${UEFI_PLATFORM_DIR}/CheckImage.cmake
  COMMENT "Linking and checking CIFSDrv.efi"
  VERBATIM)
add_custom_target(cifsdrv_efi ALL DEPENDS ${CIFSDRV_EFI})
