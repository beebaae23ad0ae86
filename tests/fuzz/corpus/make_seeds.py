#!/usr/bin/env python3
"""Writes the seed inputs of the metadata and plist fuzz targets.

Run from anywhere: python3 tests/fuzz/corpus/make_seeds.py. Python's
plistlib writes binary lists that share equal objects by reference, which
is what the byte-budget seeds need.
"""
import os
import plistlib

here = os.path.dirname(os.path.abspath(__file__))


def write(target, name, data):
    os.makedirs(os.path.join(here, target), exist_ok=True)
    with open(os.path.join(here, target, name), "wb") as f:
        f.write(data)


binary = plistlib.FMT_BINARY
xml = plistlib.FMT_XML

# Metadata files of a data container (class 2) of the mobile user, in the
# legacy form that names the owner by its uid.
metadata = {
    "VSAMetadataIdentifier": "com.example.app",
    "VSAMetadataUUID": "0A1B2C3D-0000-4000-8000-00000000F00D",
    "VSAMetadataContentClass": 2,
    "VSAMetadataPersona": 501,
    "VSAMetadataVersion": "2",
}
write("metadata", "legacy", plistlib.dumps(metadata, fmt=binary))
with_info = dict(metadata, VSAMetadataInfo={"com.tamsk.MCMMetadataInfoDataProtectionClass": 3},
                 VSAMetadataUserManagedAssetsDirName="Assets")
write("metadata", "info", plistlib.dumps(with_info, fmt=binary))
write("metadata", "wrong-class", plistlib.dumps(dict(metadata, VSAMetadataContentClass=14),
                                                fmt=binary))
write("metadata", "xml", plistlib.dumps(metadata, fmt=xml))
# Every key's value shared from one string object.
shared = dict(metadata, VSAMetadataInfo={"k%d" % i: "same value" for i in range(200)})
write("metadata", "shared", plistlib.dumps(shared, fmt=binary))

# Decoder seeds: plain, shared references, deep nesting, both formats.
write("plist", "dict", plistlib.dumps({"a": [1, -2, 3.5, True, b"\x00\x01"], "b": "text"},
                                      fmt=binary))
write("plist", "dict-xml", plistlib.dumps({"a": [1, -2, 3.5, True, b"\x00\x01"], "b": "text"},
                                          fmt=xml))
write("plist", "shared-strings", plistlib.dumps(["one string shared " * 8] * 4000, fmt=binary))
write("plist", "shared-dicts", plistlib.dumps([{"key": "value", "n": 7}] * 2000, fmt=binary))
nested = []
for _ in range(60):
    nested = [nested, "x"]
write("plist", "nested", plistlib.dumps(nested, fmt=binary))
write("plist", "nested-xml", plistlib.dumps(nested, fmt=xml))
