# The firmware image ${CMAKE_BINARY_DIR}/CIFSDrv.efi: every application source
# and the UEFI platform sources (with OpenSSL's MD4, MD5, SHA-256 and RC4
# sources), compiled freestanding for the Microsoft x64 ABI, linked by
# lld-link as an EFI application with the entry EfiMain. Beside it, the
# firmware test images of tests/firmware.
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

# --- Third-party headers and sources ------------------------------------------
# The firmware's own protocol headers (gnu-efi) serve the TCP4/TCP6 code in
# UefiTcp.cpp, and only it: they declare the same types as the image's Uefi.h.
find_path(UEFI_GNU_EFI_INCLUDE_DIR efitcp.h PATHS /usr/include/efi NO_DEFAULT_PATH
          NO_CMAKE_FIND_ROOT_PATH)
if(NOT UEFI_GNU_EFI_INCLUDE_DIR)
  message(FATAL_ERROR "gnu-efi headers not found in /usr/include/efi (run scripts/install-deps.sh)")
endif()
set_source_files_properties(${UEFI_PLATFORM_DIR}/UefiTcp.cpp PROPERTIES COMPILE_OPTIONS
  "-isystem;${UEFI_GNU_EFI_INCLUDE_DIR};-isystem;${UEFI_GNU_EFI_INCLUDE_DIR}/x86_64")

# OpenSSL's MD4, MD5, SHA-256 and RC4, compiled from Debian's source package
# with the image's code generation (never from a prebuilt library). The fetch script
# returns at once when the pinned sources are already prepared.
set(CIFSDRV_OPENSSL_SRC "${CMAKE_SOURCE_DIR}/build/openssl-src" CACHE PATH
    "Where scripts/fetch-openssl-src.sh keeps the OpenSSL sources for the image")
execute_process(COMMAND bash ${CMAKE_SOURCE_DIR}/scripts/fetch-openssl-src.sh ${CIFSDRV_OPENSSL_SRC}
                RESULT_VARIABLE openssl_fetch_rc)
if(NOT openssl_fetch_rc EQUAL 0)
  message(FATAL_ERROR "Could not prepare the OpenSSL sources (scripts/fetch-openssl-src.sh)")
endif()
# A new pinned version in the script means configuring (and fetching) again.
set_property(DIRECTORY APPEND PROPERTY CMAKE_CONFIGURE_DEPENDS
             ${CMAKE_SOURCE_DIR}/scripts/fetch-openssl-src.sh)
set(UEFI_OPENSSL_DIR ${CIFSDRV_OPENSSL_SRC}/src)
# Stand-ins for the few C library headers the sources include, and the base
# type names OpenSSL's UEFI configuration expects.
set(UEFI_OPENSSL_SHIM_DIR ${UEFI_PLATFORM_DIR}/OpenSslShim)
set(UEFI_OPENSSL_FLAGS -include ${UEFI_OPENSSL_SHIM_DIR}/UefiBaseTypes.h -DSIXTY_FOUR_BIT)
# Only UefiCrypto.cpp sees OpenSSL's headers.
set_source_files_properties(${UEFI_PLATFORM_DIR}/UefiCrypto.cpp PROPERTIES COMPILE_OPTIONS
  "${UEFI_OPENSSL_FLAGS};-isystem;${UEFI_OPENSSL_DIR}/include")

# --- C++: the application and the platform -------------------------------
# Three object sets: the application, its freestanding base library and the
# platform. The firmware test images (tests/firmware) link the last two with
# a test entry of their own, so the product image carries no test code.
file(GLOB UEFI_BASE_LIBRARY_SOURCES CONFIGURE_DEPENDS ${CMAKE_SOURCE_DIR}/App/NwFsDrv/Library/*.cpp)
set(UEFI_APP_SOURCES ${APP_SOURCES})
list(REMOVE_ITEM UEFI_APP_SOURCES ${UEFI_BASE_LIBRARY_SOURCES})
function(cifsdrv_image_object_library name)
  add_library(${name} OBJECT ${ARGN})
  target_include_directories(${name} PRIVATE ${APP_INCLUDE_DIRS})
  target_compile_options(${name} PRIVATE ${UEFI_CODEGEN_FLAGS} ${APP_FLAGS})
endfunction()
cifsdrv_image_object_library(cifsdrv_image_objects ${UEFI_APP_SOURCES})
cifsdrv_image_object_library(cifsdrv_image_base_objects ${UEFI_BASE_LIBRARY_SOURCES})
cifsdrv_image_object_library(cifsdrv_image_platform_objects ${UEFI_PLATFORM_SOURCES})
set(UEFI_SUPPORT_OBJECTS $<TARGET_OBJECTS:cifsdrv_image_base_objects>
    $<TARGET_OBJECTS:cifsdrv_image_platform_objects>)
set(UEFI_IMAGE_OBJECTS $<TARGET_OBJECTS:cifsdrv_image_objects> ${UEFI_SUPPORT_OBJECTS})

# --- C: third-party sources built into the image -------------------------
# C files with their include directories and configuration. They get the
# same code generation (no red zone above all: firmware interrupts run on
# the image's stack) but not the project's warning policy.
set(UEFI_C_SOURCES
    ${UEFI_OPENSSL_DIR}/crypto/md4/md4_dgst.c
    ${UEFI_OPENSSL_DIR}/crypto/md5/md5_dgst.c
    ${UEFI_OPENSSL_DIR}/crypto/sha/sha256.c
    ${UEFI_OPENSSL_DIR}/crypto/rc4/rc4_skey.c
    ${UEFI_OPENSSL_DIR}/crypto/rc4/rc4_enc.c)
set(UEFI_C_INCLUDE_DIRS ${UEFI_OPENSSL_SHIM_DIR} ${UEFI_OPENSSL_DIR}/include)
set(UEFI_C_DEFINITIONS "")
if(UEFI_C_SOURCES)
  add_library(cifsdrv_image_c_objects OBJECT ${UEFI_C_SOURCES})
  target_include_directories(cifsdrv_image_c_objects PRIVATE ${UEFI_C_INCLUDE_DIRS})
  target_compile_definitions(cifsdrv_image_c_objects PRIVATE ${UEFI_C_DEFINITIONS})
  target_compile_options(cifsdrv_image_c_objects PRIVATE ${UEFI_CODEGEN_FLAGS} -std=c11 -w
                                                         ${UEFI_OPENSSL_FLAGS})
  list(APPEND UEFI_SUPPORT_OBJECTS $<TARGET_OBJECTS:cifsdrv_image_c_objects>)
  list(APPEND UEFI_IMAGE_OBJECTS $<TARGET_OBJECTS:cifsdrv_image_c_objects>)
endif()

# --- Link and check --------------------------------------------------------
# cifsdrv_link_efi(TARGET NAME OBJECTS...): links ${CMAKE_BINARY_DIR}/NAME.efi
# with its map and checks it (CheckImage.cmake). The object list goes through
# a response file, which the post-link check reads as well.
function(cifsdrv_link_efi target name)
  set(efi ${CMAKE_BINARY_DIR}/${name}.efi)
  set(map ${CMAKE_BINARY_DIR}/${name}.map)
  set(rsp ${CMAKE_BINARY_DIR}/${name}.objects.rsp)
  file(GENERATE OUTPUT ${rsp} CONTENT "\"$<JOIN:${ARGN},\"\n\">\"\n")
  add_custom_command(
    OUTPUT ${efi}
    COMMAND ${CMAKE_COMMAND} -E remove -f ${efi}
    COMMAND ${UEFI_LLD_LINK} /nologo /machine:x64 /subsystem:efi_application /entry:EfiMain
            /nodefaultlib /map:${map} /out:${efi} @${rsp}
    COMMAND ${CMAKE_COMMAND} -DREADOBJ=${UEFI_LLVM_READOBJ} -DIMAGE=${efi}
            -DOBJECT_LIST=${rsp} -P ${UEFI_PLATFORM_DIR}/CheckImage.cmake
    DEPENDS ${ARGN} ${rsp} ${UEFI_PLATFORM_DIR}/CheckImage.cmake
    COMMENT "Linking and checking ${name}.efi"
    VERBATIM)
  add_custom_target(${target} ALL DEPENDS ${efi})
endfunction()

cifsdrv_link_efi(cifsdrv_efi CIFSDrv ${UEFI_IMAGE_OBJECTS})

# --- Firmware test images ------------------------------------------------------
# Small images that exercise the platform inside real firmware (QEMU/OVMF):
# tests/firmware/<Name>.cpp becomes <Name>.efi beside CIFSDrv.efi, run by the
# scripts tests/firmware/run-*.sh.
set(UEFI_TEST_IMAGES CryptoCheck NetCheck)
foreach(test_image ${UEFI_TEST_IMAGES})
  cifsdrv_image_object_library(${test_image}_objects
                               ${CMAKE_SOURCE_DIR}/tests/firmware/${test_image}.cpp
                               ${CMAKE_SOURCE_DIR}/tests/firmware/FirmwareTestConsole.cpp)
  target_include_directories(${test_image}_objects PRIVATE ${CMAKE_SOURCE_DIR}/tests/firmware
                                                           ${UEFI_PLATFORM_DIR})
  cifsdrv_link_efi(${test_image}_efi ${test_image} $<TARGET_OBJECTS:${test_image}_objects>
                   ${UEFI_SUPPORT_OBJECTS})
endforeach()
