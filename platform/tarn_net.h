// The appliance's network card, as the song URLs handed to renderers need it.
#ifndef TARN_NET_H
#define TARN_NET_H

struct TARN_NET_CARD {
    char name[64];      // interface name, e.g. "eth0"
    char ip[64];        // IPv4 address text, e.g. "192.168.1.20"
};

// Fills card with the first network card: the first interface that is up,
// not the loopback and has an IPv4 address (in getifaddrs order).
// /etc/tarninfo.conf may name the card instead: "net_card1_ifname" picks
// that interface's IPv4 address, "net_card1_address" gives the address text
// outright (it wins when both are set).
// Returns 1 found, 0 no such card, -1 error (logged).
int TARNNetGetCard1(TARN_NET_CARD *card);

#endif
