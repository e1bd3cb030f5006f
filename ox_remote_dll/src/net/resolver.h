// Look-ups in the system's name service.
#pragma once

#include <netinet/in.h>

#include <cstddef>
#include <string>

// Goes through the socket's function table: by the re-entrant forms of the C library's own functions, so that a slow
// name service holds up nobody else, and one at a time where the table holds another function. They may block for as
// long as the name service does.
class oxResolver {
public:
    // The address bytes and the family of the host's first address; both are left alone when it is not found.
    static bool FindHost(const char* host, in_addr& address, sa_family_t& family);
    // The official name of an address; empty when it has none.
    static std::string NameOf(in_addr address, sa_family_t family);
    // The port in network order; left alone when the service is not known.
    static bool FindService(const char* service, const char* protocol, in_port_t& port);
    // This machine's own name, cut to the buffer and always terminated; false when the system does not tell.
    static bool ReadHostName(char* name, std::size_t size);
    // Reads it into the process's own copy.
    static void RefreshHostName();
};
