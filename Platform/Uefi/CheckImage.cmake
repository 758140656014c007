# Post-link check of CIFSDrv.efi, run as
#   cmake -DREADOBJ=<llvm-readobj> -DIMAGE=<CIFSDrv.efi> -DOBJECT_LIST=<rsp> -P CheckImage.cmake
#
# The image has no C runtime start-up code, so nothing would ever run global
# constructors or set up thread-local storage: an object that needs either is
# a build error here rather than a silent misbehaviour in firmware. The image
# itself must be a relocatable x86-64 EFI application that imports nothing.
foreach(var READOBJ IMAGE OBJECT_LIST)
  if(NOT ${var})
    message(FATAL_ERROR "CheckImage: ${var} not given")
  endif()
endforeach()

set(failures "")

# --- Objects: no constructor tables, no thread-local data -------------------
file(STRINGS ${OBJECT_LIST} object_lines)
set(objects "")
foreach(line IN LISTS object_lines)
  string(REPLACE "\"" "" line "${line}")
  string(STRIP "${line}" line)
  if(line)
    list(APPEND objects "${line}")
  endif()
endforeach()
if(NOT objects)
  message(FATAL_ERROR "CheckImage: no objects listed in ${OBJECT_LIST}")
endif()

execute_process(COMMAND ${READOBJ} --sections ${objects}
                OUTPUT_VARIABLE sections_text RESULT_VARIABLE rc)
if(NOT rc EQUAL 0)
  message(FATAL_ERROR "CheckImage: ${READOBJ} --sections failed on the objects")
endif()
# One list element per line. Brackets would keep CMake from splitting the
# list, and the objects' own semicolons are no separators.
string(REPLACE ";" "," sections_text "${sections_text}")
string(REPLACE "[" "(" sections_text "${sections_text}")
string(REPLACE "]" ")" sections_text "${sections_text}")
string(REPLACE "\n" ";" sections_lines "${sections_text}")
set(current_file "")
foreach(line IN LISTS sections_lines)
  if(line MATCHES "^File: (.*)$")
    set(current_file "${CMAKE_MATCH_1}")
  elseif(line MATCHES "^ *Name: (\\.ctors|\\.dtors|\\.init_array|\\.fini_array|\\.CRT\\$X[CILPT]|\\.tls)([^ ]*)")
    list(APPEND failures "${current_file}: section ${CMAKE_MATCH_1}${CMAKE_MATCH_2} (global constructor, destructor or thread-local data)")
  endif()
endforeach()

# --- The image ---------------------------------------------------------------
execute_process(COMMAND ${READOBJ} --file-headers --sections --coff-imports ${IMAGE}
                OUTPUT_VARIABLE image_text RESULT_VARIABLE rc)
if(NOT rc EQUAL 0)
  message(FATAL_ERROR "CheckImage: ${READOBJ} could not read ${IMAGE}")
endif()
if(NOT image_text MATCHES "Machine: IMAGE_FILE_MACHINE_AMD64")
  list(APPEND failures "${IMAGE}: not an x86-64 image")
endif()
if(NOT image_text MATCHES "Subsystem: IMAGE_SUBSYSTEM_EFI_APPLICATION")
  list(APPEND failures "${IMAGE}: subsystem is not EFI application")
endif()
if(image_text MATCHES "IMAGE_FILE_RELOCS_STRIPPED")
  list(APPEND failures "${IMAGE}: base relocations stripped; firmware may load the image anywhere")
endif()
if(image_text MATCHES "Import {")
  list(APPEND failures "${IMAGE}: imports from a DLL")
endif()
if(image_text MATCHES "AddressOfEntryPoint: 0x0\n")
  list(APPEND failures "${IMAGE}: no entry point")
endif()
if(image_text MATCHES "Name: (\\.ctors|\\.CRT|\\.tls|\\.init_array)")
  list(APPEND failures "${IMAGE}: section ${CMAKE_MATCH_1}")
endif()

if(failures)
  file(REMOVE ${IMAGE})
  list(JOIN failures "\n  " text)
  message(FATAL_ERROR "CIFSDrv.efi rejected:\n  ${text}")
endif()
