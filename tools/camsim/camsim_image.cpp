// camsim: preset images (libturbojpeg) and the digests of both auth schemes
// (OpenSSL).
#include <openssl/evp.h>
#include <openssl/sha.h>
#include <turbojpeg.h>

#include <cstdint>
#include <vector>

#include "camsim.h"

namespace camsim {

void PresetColour(const std::string& token, unsigned char rgb[3]) {
    if (token.empty()) {
        rgb[0] = rgb[1] = rgb[2] = 128;
        return;
    }
    uint32_t h = 2166136261u;
    for (unsigned char c : token) h = (h ^ c) * 16777619u;
    rgb[0] = static_cast<unsigned char>(h >> 16);
    rgb[1] = static_cast<unsigned char>(h >> 8);
    rgb[2] = static_cast<unsigned char>(h);
}

std::string PresetJpeg(const std::string& token, int width, int height) {
    unsigned char rgb[3];
    PresetColour(token, rgb);
    std::vector<unsigned char> pixels(static_cast<size_t>(width) * height * 3);
    for (size_t i = 0; i < pixels.size(); i += 3) {
        pixels[i] = rgb[0];
        pixels[i + 1] = rgb[1];
        pixels[i + 2] = rgb[2];
    }
    tjhandle tj = tjInitCompress();
    if (!tj) return {};
    unsigned char* jpeg = nullptr;
    unsigned long size = 0;
    std::string out;
    if (tjCompress2(tj, pixels.data(), width, 0, height, TJPF_RGB, &jpeg, &size, TJSAMP_444, 90,
                    0) == 0)
        out.assign(reinterpret_cast<char*>(jpeg), size);
    tjFree(jpeg);
    tjDestroy(tj);
    return out;
}

std::string Base64Encode(const std::string& bytes) {
    std::string out(4 * ((bytes.size() + 2) / 3) + 1, '\0');
    int n = EVP_EncodeBlock(reinterpret_cast<unsigned char*>(&out[0]),
                            reinterpret_cast<const unsigned char*>(bytes.data()),
                            static_cast<int>(bytes.size()));
    out.resize(n);
    return out;
}

std::string Base64Decode(const std::string& text) {
    std::string in;
    for (char c : text)
        if (c != ' ' && c != '\n' && c != '\r' && c != '\t') in += c;
    if (in.size() % 4 != 0) return {};
    std::string out(in.size() / 4 * 3 + 1, '\0');
    int n = EVP_DecodeBlock(reinterpret_cast<unsigned char*>(&out[0]),
                            reinterpret_cast<const unsigned char*>(in.data()),
                            static_cast<int>(in.size()));
    if (n < 0) return {};
    size_t len = static_cast<size_t>(n);
    if (!in.empty() && in[in.size() - 1] == '=') --len;
    if (in.size() > 1 && in[in.size() - 2] == '=') --len;
    out.resize(len);
    return out;
}

std::string Sha1(const std::string& bytes) {
    unsigned char d[SHA_DIGEST_LENGTH];
    SHA1(reinterpret_cast<const unsigned char*>(bytes.data()), bytes.size(), d);
    return std::string(reinterpret_cast<char*>(d), sizeof d);
}

std::string Md5Hex(const std::string& bytes) {
    unsigned char d[16];
    unsigned int len = 0;
    EVP_Digest(bytes.data(), bytes.size(), d, &len, EVP_md5(), nullptr);
    static const char* hex = "0123456789abcdef";
    std::string out;
    for (unsigned int i = 0; i < len; ++i) {
        out += hex[d[i] >> 4];
        out += hex[d[i] & 15];
    }
    return out;
}

}  // namespace camsim
