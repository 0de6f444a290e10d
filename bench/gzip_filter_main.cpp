// The archive's gzip child on its own.
#include "archive/gzip_stream.h"

int main() {
    gzip_filter();
    return 0;
}
