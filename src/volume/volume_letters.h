// Volume letters of the drives.
#pragma once

// Fills volumeLetters, volumeCount and volumeDriveType of every drive record.
// Always called right after EnumerateDrives, with the mutex held.
void AssignVolumeLetters();
