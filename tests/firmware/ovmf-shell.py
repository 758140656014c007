#!/usr/bin/env python3
"""Writes the UEFI Shell application built into an OVMF code image to a file.

    ovmf-shell.py OVMF_CODE.fd OUT.efi

The firmware keeps its DXE volume LZMA-compressed inside a GUID-defined
section; the shell is the application file named by the shell's file GUID
in that volume, and its PE32 section is the image. The end-to-end test uses
the copy to start a second shell with options the built-in one was not
given ("-nonest"). Exit status 1 when no shell is found.
"""
import lzma
import struct
import sys
import uuid

LZMA_SECTION_GUID = uuid.UUID("EE4E5898-3914-4259-9D6E-DC7BD79403CF").bytes_le
SHELL_FILE_GUID = uuid.UUID("7C04A583-9E3E-4F1C-AD65-E05268D0B4D1").bytes_le
SECTION_GUID_DEFINED = 0x02
SECTION_PE32 = 0x10
FILE_TYPE_APPLICATION = 0x09
FILE_HEADER_BYTES = 24


def size24(data, offset):
    return int.from_bytes(data[offset:offset + 3], "little")


def decompressed_volumes(image):
    """Every LZMA-compressed GUID-defined section of the image, unpacked."""
    found = image.find(LZMA_SECTION_GUID)
    while found >= 4:
        section = found - 4
        if image[section + 3] == SECTION_GUID_DEFINED:
            size = size24(image, section)
            (data_offset,) = struct.unpack_from("<H", image, found + 16)
            unpacker = lzma.LZMADecompressor(format=lzma.FORMAT_ALONE)
            yield unpacker.decompress(image[section + data_offset:section + size])
        found = image.find(LZMA_SECTION_GUID, found + 1)


def shell_pe32(volume):
    """The PE32 section of the shell's application file in VOLUME, or None."""
    found = volume.find(SHELL_FILE_GUID)
    while found >= 0:
        file_size = size24(volume, found + 20)
        if volume[found + 18] == FILE_TYPE_APPLICATION and file_size > FILE_HEADER_BYTES:
            section = found + FILE_HEADER_BYTES
            end = min(found + file_size, len(volume))
            while section + 4 <= end:
                section_size = size24(volume, section)
                if section_size < 4:
                    break
                if volume[section + 3] == SECTION_PE32:
                    return volume[section + 4:section + section_size]
                section = (section + section_size + 3) & ~3
        found = volume.find(SHELL_FILE_GUID, found + 1)
    return None


def main():
    if len(sys.argv) != 3:
        sys.exit(f"usage: {sys.argv[0]} OVMF_CODE.fd OUT.efi")
    with open(sys.argv[1], "rb") as code:
        image = code.read()
    for volume in decompressed_volumes(image):
        pe32 = shell_pe32(volume)
        if pe32 is not None and pe32[:2] == b"MZ":
            with open(sys.argv[2], "wb") as out:
                out.write(pe32)
            return
    sys.exit(f"no UEFI Shell application found in {sys.argv[1]}")


if __name__ == "__main__":
    main()
