// nesrad: the iSNS client daemon. Placeholder until the main loop lands.
#include "common/korvadm_log.h"

int main(int argc, char **argv)
{
    if (argc != 2 || !argv[1][0]) {
        DBG(0, "usage: nesrad <iSNS server>");
        return 1;
    }
    DBG(0, "not yet implemented");
    return 1;
}
