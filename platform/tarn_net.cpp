#include "platform/tarn_net.h"

#include <arpa/inet.h>
#include <ifaddrs.h>
#include <net/if.h>
#include <netinet/in.h>

#include <cstdio>
#include <cstring>
#include <string>

#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "platform/tlibc_conf.h"

static const char kLogUnit[] = "net";

int TARNNetGetCard1(TARN_NET_CARD *card)
{
    if (!card) {
        TLOG("Bad parameter");
        return -1;
    }
    memset(card, 0, sizeof(*card));

    std::string conf = TarnPath(TARN_INFO_CONF);
    char address[64] = "";
    char wanted[IFNAMSIZ + 1] = "";
    if (TLIBCFileGetKeyValue(conf.c_str(), "net_card1_address", address, sizeof(address), 0) > 0) {
        struct in_addr a;
        if (inet_pton(AF_INET, address, &a) != 1) {
            TLOG("Bad net_card1_address [%s] in %s", address, conf.c_str());
            return -1;
        }
        snprintf(card->name, sizeof(card->name), "%s", "configured");
        snprintf(card->ip, sizeof(card->ip), "%s", address);
        return 1;
    }
    TLIBCFileGetKeyValue(conf.c_str(), "net_card1_ifname", wanted, sizeof(wanted), 0);

    struct ifaddrs *list = nullptr;
    if (getifaddrs(&list) != 0) {
        TLOG("Failed to list network interfaces, %m");
        return -1;
    }
    int found = 0;
    for (struct ifaddrs *i = list; i; i = i->ifa_next) {
        if (!i->ifa_addr || i->ifa_addr->sa_family != AF_INET || !i->ifa_name)
            continue;
        if (wanted[0]) {
            if (strcmp(i->ifa_name, wanted) != 0)
                continue;
        } else if ((i->ifa_flags & IFF_LOOPBACK) || !(i->ifa_flags & IFF_UP)) {
            continue;
        }
        const struct sockaddr_in *sin = reinterpret_cast<const struct sockaddr_in *>(i->ifa_addr);
        if (!inet_ntop(AF_INET, &sin->sin_addr, card->ip, sizeof(card->ip)))
            continue;
        snprintf(card->name, sizeof(card->name), "%s", i->ifa_name);
        found = 1;
        break;
    }
    freeifaddrs(list);
    return found;
}
