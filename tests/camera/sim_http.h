// How many requests the camera simulator received, read beside the driver
// with plain libcurl.
#ifndef TESTS_CAMERA_SIM_HTTP_H
#define TESTS_CAMERA_SIM_HTTP_H

#include <curl/curl.h>

#include <cstdlib>
#include <string>

// Requests the simulator on `port` received, control endpoints aside.
inline long SimRequests(int port) {
    std::string body, url = "http://127.0.0.1:" + std::to_string(port) + "/control/requests";
    CURL* curl = curl_easy_init();
    curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl, CURLOPT_TIMEOUT_MS, 5000L);
    size_t (*append)(char*, size_t, size_t, void*) = [](char* d, size_t s, size_t n, void* out) {
        static_cast<std::string*>(out)->append(d, s * n);
        return s * n;
    };
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, append);
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, &body);
    curl_easy_perform(curl);
    curl_easy_cleanup(curl);
    return atol(body.c_str());
}

#endif  // TESTS_CAMERA_SIM_HTTP_H
