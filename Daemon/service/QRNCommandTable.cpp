#include "Daemon/service/QRNCommandTable.h"

#include "Daemon/service/QRNCommandHandlers.h"

namespace quarn {

namespace {

using H = QRNCommandHandlers;
using T = QRNCommandTable;

constexpr bool R = true;  // replyBySender
constexpr bool U = true;  // allowsUnentitled
constexpr bool L = true;  // honoursLookupEntitlement
constexpr bool N = false; // flag clear

// Commands 4 and 21 reply from their own completion. Command 4 is admitted
// by the user-managed-assets entitlement and 8 and 22 are the same work,
// both on purpose; 27 is retired but keeps its number.
constexpr std::array<QRNCommandTableEntry, T::kCount> kEntries{{
    {0, &H::createOrLookupContainer, T::kAllowed, R, U, L},
    {1, &H::containersWithClass, T::kAllowed, R, N, L},
    {2, &H::notAvailable, T::kAllowed, R, N, N},
    {3, &H::stageContainersForDelete, T::kAllowed, R, N, N},
    {4, &H::deleteContainersOnDeathRow, T::kUserManagedAssets, N, N, N},
    {5, &H::setInfoValue, T::kAllowed, R, N, N},
    {6, &H::infoValue, T::kAllowed, R, N, N},
    {7, &H::containerMetadata, T::kAllowed, R, N, N},
    {8, &H::recreateDefaultStructure, T::kAllowed, R, N, N},
    {9, &H::regenerateDirectoryUUID, T::kAllowed, R, N, N},
    {10, &H::deleteContainer, T::kAllowed, R, N, N},
    {11, &H::notAvailable, T::kWipeContainer, R, N, N},
    {12, &H::notAvailable, T::kDeleteContainerContent, R, N, N},
    {13, &H::groupContainersForOwner, T::kAllowed, R, U, L},
    {14, &H::groupIdentifiersForOwner, T::kAllowed, R, N, L},
    {15, &H::systemContainerPath, T::kAllowed, R, U, L},
    {16, &H::systemGroupContainersForOwner, T::kAllowed, R, U, L},
    {17, &H::systemGroupContainerPath, T::kAllowed, R, U, L},
    {18, &H::notAvailable, T::kAllowed, R, N, N},
    {19, &H::notAvailable, T::kAllowed, R, N, N},
    {20, &H::notAvailable, T::kAllowed, R, N, N},
    {21, &H::notAvailable, T::kAllowed, N, N, N},
    {22, &H::recreateDefaultStructure, T::kAllowed, R, N, N},
    {23, &H::diskUsage, T::kAllowed, R, N, L},
    {24, &H::notAvailable, T::kDataMigration, R, N, N},
    {25, &H::notAvailable, T::kTestability, R, N, N},
    {26, &H::notAvailable, T::kStageSharedContent, R, N, N},
    {27, &H::retired, T::kAllowed, R, N, N},
    {28, &H::notAvailable, T::kUserManagedAssets, R, U, N},
    {29, &H::notAvailable, T::kUserManagedAssets, R, N, N},
    {30, &H::notAvailable, T::kAllowed, R, N, N},
    {31, &H::notAvailable, T::kTestability, R, N, N},
    {32, &H::personaUniqueStrings, T::kAllowed, R, U, L},
}};

} // namespace

const std::array<QRNCommandTableEntry, QRNCommandTable::kCount>& QRNCommandTable::entries() {
    return kEntries;
}

} // namespace quarn
