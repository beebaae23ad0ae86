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

# The daemon's own state files (root-only, but read after crashes and
# upgrades): a replace journal, a pending protection update, the migration
# status with a system-version file, a client registry entry, personas.
journal = {
    "VSAReplaceOperationOldURL": "/private/var/mobile/Containers/Data/Application/A",
    "VSAReplaceOperationNewURL": "/private/var/mobile/Containers/Data/Application/B",
    "VSAReplaceOperationStagingURL": "/private/var/mobile/Containers/Staging/C",
    "VSAReplaceOperationDestURL": "/private/var/mobile/Containers/Data/Application/D",
}
write("replacefile", "journal", plistlib.dumps(journal, fmt=binary))
write("replacefile", "dotdot", plistlib.dumps(
    dict(journal, VSAReplaceOperationDestURL="/private/var/../etc"), fmt=binary))
write("replacefile", "xml", plistlib.dumps(journal, fmt=xml))
update = {
    "VSADataOperationIdentifier": "com.example.app",
    "VSADataOperationContainerClass": 2,
    "VSADataOperationProtectionClass": 3,
    "VSADataOperationChangeType": 0,
    "VSADataOperationRetryIfLocked": True,
    "VSADataOperationInternalID": "0A1B2C3D-0000-4000-8000-00000000F00D",
    "VSADataOperationUserId": 501,
}
write("updatefile", "update", plistlib.dumps(update, fmt=binary))
write("updatefile", "system", plistlib.dumps(
    dict(update, VSADataOperationContainerClass=12), fmt=binary))
write("updatefile", "negative-class", plistlib.dumps(
    dict(update, VSADataOperationProtectionClass=-1), fmt=binary))
# statusfile: the first half of the input is the status, the second the version.
status = plistlib.dumps({"LastBuildInfo": {"BuildVersion": "1A100", "ReleaseType": "User"},
                         "CodeSigningMigration": True, "VSAMigrationVersionNumber": 3},
                        fmt=binary)
version = plistlib.dumps({"BuildVersion": "1A200", "ReleaseType": "User"}, fmt=binary)
pad = max(len(status), len(version))
write("statusfile", "upgrade", status.ljust(pad, b"\0") + version.ljust(pad, b"\0"))
write("statusfile", "same-build", version.ljust(pad, b"\0") + version.ljust(pad, b"\0"))
entry = {"Executable": "/usr/bin/client", "SigningIdentifier": "com.example.client",
         "Entitlements": {"com.tamsk.private.Vessa.allowed": True,
                          "com.tamsk.security.application-groups": ["group.example"]},
         "Sandboxed": False, "KernelBridge": False, "User": 501}
write("registry", "entry", plistlib.dumps(entry, fmt=binary))
write("registry", "entry-xml", plistlib.dumps(entry, fmt=xml))
write("registry", "bad-types", plistlib.dumps(dict(entry, Entitlements=["x"], User="root"),
                                              fmt=binary))
personas = [{"PersonaID": 1000, "Kind": "personal", "UniqueString": "PERSONAL-1000"},
            {"PersonaID": 1001, "Kind": "enterprise", "UniqueString": "WORK-1001",
             "LayoutPath": "/private/var/enterprise/1001",
             "BundleIdentifiers": ["com.example.work"]},
            {"PersonaID": 1002, "Kind": "universal", "UniqueString": "U"},
            {"PersonaID": 1003, "Kind": "system", "UniqueString": "S"}]
write("personas", "four-kinds", plistlib.dumps(personas, fmt=binary))
write("personas", "four-kinds-xml", plistlib.dumps(personas, fmt=xml))
write("personas", "wrapped", plistlib.dumps({"Personas": personas}, fmt=binary))
