#pragma once

// Local stream sockets by name, as libcutils offers them on the phone, served
// by the host layer. A name in the abstract namespace is the abstract socket
// of that name when no private root is set; with a private root
// (kelvo/RootPath.h) it is the socket file <root>/dev/socket/<name>, so
// daemons on different roots never meet and their clients find them the same
// way. A name in the filesystem namespace is a path, resolved below the root.

#define ANDROID_SOCKET_NAMESPACE_ABSTRACT 0
#define ANDROID_SOCKET_NAMESPACE_RESERVED 1
#define ANDROID_SOCKET_NAMESPACE_FILESYSTEM 2

#ifdef __cplusplus
extern "C" {
#endif

// A listening socket bound to the name (a stale socket file is replaced, the
// parent folder created); the descriptor, or -1 with errno set.
int socket_local_server(const char* name, int namespaceId, int type);
// A socket connected to the named server; the descriptor, or -1 with errno set.
int socket_local_client(const char* name, int namespaceId, int type);

#ifdef __cplusplus
}
#endif
