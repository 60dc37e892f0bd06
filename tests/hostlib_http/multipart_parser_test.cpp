// The multipart parser as a pure function of bytes: every way of splitting a
// stream gives the same parts; cut or foreign streams never yield a partial part.
#include <random>

#include <gtest/gtest.h>

#include "hostlib/http/multipart_parser.h"

namespace {

using R = MultipartParser::Result;

// A JPEG-like payload full of near misses of the delimiter "--frame".
std::string Payload(size_t size, unsigned seed) {
    std::mt19937 rng(seed);
    const char* tricky[] = {"\r\n", "\n", "--", "\r\n--fram", "\n--framex\r\n", "x--frame--\r\n", "\r\n--frame-x"};
    std::string s = "\xff\xd8";
    while (s.size() < size) s += rng() % 16 ? std::string(1, static_cast<char>(rng())) : tricky[rng() % 7];
    s.resize(size);
    return s;
}

struct Style {
    const char* name;
    std::string eol;
    bool lengths, leadingDelimiter, closing;
};
const Style kStyles[] = {
    {"CRLF lengths", "\r\n", true, true, true},  {"CRLF delimited", "\r\n", false, true, true},
    {"LF lengths", "\n", true, true, false},     {"LF delimited", "\n", false, true, true},
    {"no first delimiter, lengths", "\r\n", true, false, false},
    {"no first delimiter, delimited", "\r\n", false, false, true},
};

std::string Build(const Style& st, const std::vector<std::string>& parts) {
    std::string s;
    for (size_t i = 0; i < parts.size(); ++i) {
        if (i > 0 || st.leadingDelimiter) s += "--frame" + st.eol;
        s += "Content-Type: image/jpeg" + st.eol;
        if (st.lengths) s += "Content-Length: " + std::to_string(parts[i].size()) + st.eol;
        s += st.eol + parts[i] + st.eol;
    }
    return st.closing ? s + "--frame--" + st.eol : s;
}

// Feeds `stream` in pieces of the sizes in `chunks` (cycled; empty: all at once).
std::vector<std::string> Parse(const std::string& stream, const std::string& boundary,
                               const std::vector<size_t>& chunks, R* end) {
    MultipartParser parser(boundary);
    std::vector<std::string> parts;
    MultipartPart part;
    size_t at = 0, i = 0;
    for (;;) {
        while ((*end = parser.Next(part)) == R::kPart) parts.push_back(part.content);
        if (*end != R::kNeedMore) return parts;
        if (at == stream.size()) {
            parser.End();
            continue;
        }
        size_t n = std::min(chunks.empty() ? stream.size() : chunks[i++ % chunks.size()], stream.size() - at);
        parser.Feed(stream.data() + at, n);
        at += n;
    }
}

TEST(MultipartParser, EverySplitGivesTheSamePartsAndCutsNeverAPartialOne) {
    const std::vector<std::string> parts = {Payload(5000, 1), "", Payload(70000, 2), "x"};
    std::mt19937 rng(7);
    std::vector<size_t> randomChunks;
    for (int i = 0; i < 64; ++i) randomChunks.push_back(1 + rng() % 3000);
    const struct {
        const char* name;
        std::vector<size_t> chunks;
    } splits[] = {{"whole", {}}, {"byte by byte", {1}}, {"random chunks", randomChunks}};
    for (const Style& st : kStyles) {
        const std::string stream = Build(st, parts);
        // The boundary parameter with and without "--", or none (learned from the first delimiter).
        for (std::string param : {"frame", "--frame", ""}) {
            if (param.empty() && !st.leadingDelimiter && !st.lengths) continue;
            for (const auto& split : splits) {
                SCOPED_TRACE(std::string(st.name) + ", boundary '" + param + "', " + split.name);
                R end;
                EXPECT_EQ(Parse(stream, param, split.chunks, &end), parts);
                EXPECT_EQ(end, R::kEnd);
            }
        }
        // Truncated: every prefix gives whole parts only; a cut inside content is an error.
        SCOPED_TRACE(st.name);
        const std::vector<std::string> two = {Payload(300, 3), Payload(200, 4)};
        const std::string small = Build(st, two);
        for (size_t cut = 0; cut < small.size(); ++cut) {
            R end;
            auto got = Parse(small.substr(0, cut), "frame", {}, &end);
            ASSERT_LE(got.size(), 2u);
            for (size_t i = 0; i < got.size(); ++i) ASSERT_EQ(got[i], two[i]) << cut;
            bool inContent = cut == small.find(two[0]) + 150 || cut == small.find(two[1]) + 100;
            EXPECT_TRUE(!inContent || end == R::kError) << cut;
        }
    }
}

TEST(MultipartParser, RealWorldShapesForeignStreamsAndTheSizeLimit) {
    std::string jpeg = Payload(3 << 20, 9);  // a plain JPEG where a stream was expected
    for (char& c : jpeg) c = c == ':' ? ';' : c;
    const std::string big = "--b\r\nContent-Length: ";
    struct Case {
        std::string stream, boundary;
        std::vector<std::string> parts;
        R end;
    } cases[] = {
        {"--f\r\nContent-Length: 3\r\n\r\nabcJUNK\r\n--f\r\nContent-Length: 2\r\n\r\nde\r\n", "f", {"abc", "de"}, R::kEnd},
        {"preamble\r\n--f  \r\ncontent-length: 1\r\n\r\nq\r\n--f--", "f", {"q"}, R::kEnd},
        {"--f\r\n\r\nab\r\n--fx\r\ncd\r\n--f\r\n\r\nz\r\n--f--\r\n", "f", {"ab\r\n--fx\r\ncd", "z"}, R::kEnd},
        {"Content-Length: 2\r\n\r\nAB\r\n--learned\r\nContent-Length: 1\r\n\r\nC\r\n", "", {"AB", "C"}, R::kEnd},
        {jpeg, "frame", {}, R::kError},
        {"--frame\r\n" + std::string(20000, 'h') + "\r\n", "frame", {}, R::kError},  // endless headers
        // Parts above the limit (100 here), by their length or a huge one; exactly the limit is fine.
        {big + "101\r\n\r\n" + std::string(101, 'x') + "\r\n--b--\r\n", "b", {}, R::kError},
        {big + "99999999999999999999999\r\n\r\nx", "b", {}, R::kError},
        {"--b\r\n\r\n" + std::string(100, 'z') + "\r\n--b--\r\n", "b", {std::string(100, 'z')}, R::kEnd},
    };
    for (const Case& c : cases) {
        R end;
        std::vector<std::string> got;
        for (const auto& p : ParseMultipart(c.stream, c.boundary, &end, 100)) got.push_back(p.content);
        EXPECT_EQ(got, c.parts) << c.stream.substr(0, 60);
        EXPECT_EQ(end, c.end) << c.stream.substr(0, 60);
    }
    // Without a length, a part growing past the limit fails before its end arrives.
    MultipartParser parser("b", 100);
    std::string head = "--b\r\n\r\n", block(1000, 'y');
    parser.Feed(head.data(), head.size());
    MultipartPart part;
    R r = R::kNeedMore;
    for (int i = 0; i < 100 && r == R::kNeedMore; ++i) {
        parser.Feed(block.data(), block.size());
        r = parser.Next(part);
    }
    EXPECT_EQ(r, R::kError);
    EXPECT_EQ(MultipartBoundary("multipart/x-mixed-replace;boundary=--myboundary"), "--myboundary");
    EXPECT_EQ(MultipartBoundary("multipart/x-mixed-replace; charset=x; BOUNDARY=\"a b;c\""), "a b;c");
}

}  // namespace
