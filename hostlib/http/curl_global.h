// libcurl's process-wide setup. Every hostlib user of libcurl calls
// HostCurlGlobalInit() before its first curl_easy_init/curl_multi_init.
#ifndef HOSTLIB_CURL_GLOBAL_H
#define HOSTLIB_CURL_GLOBAL_H

// Runs curl_global_init once per process, whichever thread calls first; later
// and concurrent calls wait for that one and return. Never torn down: other
// threads of the host may still use curl while the process exits.
void HostCurlGlobalInit();

#endif  // HOSTLIB_CURL_GLOBAL_H
