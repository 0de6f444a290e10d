// The local time as it stands in the names of an archive's directories.
#pragma once

struct LocalStamp {
    char text[64];  // "20240131-235959"
};

// The present local time.
LocalStamp local_stamp();
