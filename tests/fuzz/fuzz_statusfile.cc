// Fuzzes the migration status file and the system-version file it is read
// with: the first half of the input is the status file, the second the
// version file. Whatever they hold, the status answers its questions, and a
// status that records a migration keeps it across a save and a new read.
#include "VSAFuzzDevice.h"
#include "migration/VSAMigrationStatus.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static VSAFuzzDevice device("status");
  static const std::string statusFile =
      device.config->libraryDirectory() + "/" + kVSASystemMigrationStatusFileName;
  static const std::string versionFile = device.root + "/etc/vessad/system-version.plist";
  size_t half = size / 2;
  VSAFuzzDevice::put(statusFile, data, half);
  VSAFuzzDevice::put(versionFile, data + half, size - half);
  auto status = VSAMigrationStatus::initForSystemMigration(*device.config, versionFile);
  if (!status) return 0;
  (void)status->isBuildUpgrade();
  (void)status->currentBuildVersion();
  if (!status->setMigrationCompleteForType("FuzzMigration")) return 0;  // an unusable file stays
  auto again = VSAMigrationStatus::initForSystemMigration(*device.config, versionFile);
  if (!again || !again->hasMigrationOccurredForType("FuzzMigration")) __builtin_trap();
  return 0;
}
