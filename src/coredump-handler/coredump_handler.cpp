#include "coredump-handler/coredump_handler.h"

#include "coredump-handler/core_arguments.h"
#include "coredump-handler/core_config.h"
#include "coredump-handler/ftp_upload.h"
#include "coredump-handler/service_handover.h"
#include "util/standard_streams.h"

namespace {

constexpr char CONFIG_FILE[] = "/etc/conf.d/debugar.cgi";
constexpr char SERVICE_SOCKET[] = "/var/run/dbg-cgi/ctrl-segf-socket";

}  // namespace

int run_coredump_handler(int argc, char **argv) {
    // The kernel opens standard input alone.
    fill_standard_streams();
    int status;
    if (!check_core_arguments(argc, argv, &status))
        return status;
    CoreConfig config;
    if (read_core_config(CONFIG_FILE, &config) != 0)
        return 1;
    const bool delivered = config.use_ftp ? upload_core(config, core_name(argc, argv))
                                          : hand_core_over(SERVICE_SOCKET);
    return delivered ? 0 : 1;
}
