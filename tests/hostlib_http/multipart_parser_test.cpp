// The multipart parser as a pure function of bytes: the same stream whole,
// byte by byte, in random chunks and truncated must give the same parts.
#include <random>

#include <gtest/gtest.h>

#include "hostlib/multipart_parser.h"

namespace {

using R = MultipartParser::Result;

struct Expected {
    std::string contentType;  // of the part
    std::string content;
};

// A JPEG-like payload with bytes that look like line ends and delimiters.
std::string Payload(size_t size, unsigned seed) {
    std::mt19937 rng(seed);
    std::string s = "\xff\xd8\xff\xe0";
    // Near misses of the delimiter "--frame" (a real one may not occur in content).
    const char* tricky[] = {"\r\n", "\n", "--", "\r\n--", "\r\n--fram", "\n--framex\r\n",
                            "x--frame--\r\n", "\r\n--frame-x"};
    while (s.size() < size) {
        if (rng() % 16 == 0) {
            s += tricky[rng() % 8];
        } else {
            s += static_cast<char>(rng() & 0xff);
        }
    }
    s.resize(size);
    return s;
}

struct StreamStyle {
    const char* name;
    std::string eol;
    bool lengths;          // parts carry Content-Length
    bool leadingDelimiter; // a delimiter before the first part
    bool closing;          // ends with the closing delimiter
};

std::string Build(const StreamStyle& st, const std::string& boundary, const std::vector<Expected>& parts) {
    std::string s;
    for (size_t i = 0; i < parts.size(); ++i) {
        if (i > 0 || st.leadingDelimiter) s += "--" + boundary + st.eol;
        s += "Content-Type: " + parts[i].contentType + st.eol;
        if (st.lengths) s += "Content-Length: " + std::to_string(parts[i].content.size()) + st.eol;
        s += st.eol + parts[i].content + st.eol;
    }
    if (st.closing) s += "--" + boundary + "--" + st.eol;
    return s;
}

std::vector<MultipartPart> FeedInChunks(const std::string& stream, const std::string& boundary,
                                        const std::vector<size_t>& chunks, R* end) {
    MultipartParser parser(boundary);
    std::vector<MultipartPart> parts;
    MultipartPart part;
    size_t at = 0, i = 0;
    R r = R::kNeedMore;
    for (;;) {
        while ((r = parser.Next(part)) == R::kPart) parts.push_back(part);
        if (r != R::kNeedMore) break;
        if (at == stream.size()) {
            parser.End();
            continue;
        }
        size_t n = std::min(chunks[i++ % chunks.size()], stream.size() - at);
        parser.Feed(stream.data() + at, n);
        at += n;
    }
    *end = r;
    return parts;
}

void ExpectParts(const std::vector<MultipartPart>& got, const std::vector<Expected>& want) {
    ASSERT_EQ(got.size(), want.size());
    for (size_t i = 0; i < want.size(); ++i) {
        EXPECT_NE(got[i].headers.find("Content-Type: " + want[i].contentType), std::string::npos);
        EXPECT_EQ(got[i].content, want[i].content) << "part " << i;
    }
}

const StreamStyle kStyles[] = {
    {"CRLF with lengths", "\r\n", true, true, true},
    {"CRLF delimited", "\r\n", false, true, true},
    {"LF with lengths", "\n", true, true, false},
    {"LF delimited", "\n", false, true, true},
    {"no first delimiter, lengths", "\r\n", true, false, false},
    {"no first delimiter, delimited", "\r\n", false, false, true},
};

std::vector<Expected> SampleParts() {
    return {{"image/jpeg", Payload(5000, 1)}, {"image/jpeg", ""}, {"image/jpeg", Payload(70000, 2)},
            {"text/plain", "x"}};
}

TEST(MultipartParser, EverySplitOfTheStreamGivesTheSameParts) {
    const auto parts = SampleParts();
    for (const StreamStyle& st : kStyles) {
        SCOPED_TRACE(st.name);
        const std::string stream = Build(st, "frame", parts);
        // The boundary from the Content-Type, with and without "--", and none at all
        // (learned from the first delimiter line, which some styles lack).
        for (std::string param : {"frame", "--frame", ""}) {
            if (param.empty() && !st.leadingDelimiter && !st.lengths) continue;
            SCOPED_TRACE("boundary param '" + param + "'");
            R end;
            ExpectParts(ParseMultipart(stream, param, &end), parts);
            EXPECT_EQ(end, R::kEnd);

            auto bytewise = FeedInChunks(stream, param, {1}, &end);
            ExpectParts(bytewise, parts);
            EXPECT_EQ(end, R::kEnd);

            std::mt19937 rng(7);
            for (int round = 0; round < 5; ++round) {
                std::vector<size_t> chunks;
                for (int i = 0; i < 64; ++i) chunks.push_back(1 + rng() % 3000);
                ExpectParts(FeedInChunks(stream, param, chunks, &end), parts);
                EXPECT_EQ(end, R::kEnd);
            }
        }
    }
}

TEST(MultipartParser, ATruncatedStreamNeverYieldsAPartialPart) {
    const std::vector<Expected> parts = {{"image/jpeg", Payload(300, 3)}, {"image/jpeg", Payload(200, 4)}};
    for (const StreamStyle& st : kStyles) {
        SCOPED_TRACE(st.name);
        const std::string stream = Build(st, "frame", parts);
        for (size_t cut = 0; cut < stream.size(); ++cut) {
            R end;
            auto got = ParseMultipart(stream.substr(0, cut), "frame", &end);
            ASSERT_LE(got.size(), parts.size()) << cut;
            for (size_t i = 0; i < got.size(); ++i) ASSERT_EQ(got[i].content, parts[i].content) << cut;
        }
        // Cut inside a part's content: an error, never a shortened image.
        for (const Expected& p : parts) {
            size_t mid = stream.find(p.content) + p.content.size() / 2;
            R end;
            auto got = ParseMultipart(stream.substr(0, mid), "frame", &end);
            EXPECT_EQ(end, R::kError);
            EXPECT_LT(got.size(), parts.size());
        }
    }
}

TEST(MultipartParser, StreamsThatAreNotMultipartFail) {
    R end;
    // A plain JPEG where a stream was expected: no delimiter, no headers.
    std::string jpeg = Payload(3 * 1048576, 9);
    for (char& c : jpeg) if (c == ':') c = ';';
    EXPECT_TRUE(ParseMultipart(jpeg, "frame", &end).empty());
    EXPECT_EQ(end, R::kError);
    // Headers that never end.
    EXPECT_TRUE(ParseMultipart("--frame\r\n" + std::string(20000, 'h') + "\r\n", "frame", &end).empty());
    EXPECT_EQ(end, R::kError);
}

TEST(MultipartParser, PartsAboveTheLimitFail) {
    R end;
    auto got = ParseMultipart("--b\r\nContent-Length: 101\r\n\r\n" + std::string(101, 'x') + "\r\n--b--\r\n",
                              "b", &end, 100);
    EXPECT_TRUE(got.empty());
    EXPECT_EQ(end, R::kError);
    got = ParseMultipart("--b\r\nContent-Length: 99999999999999999999999\r\n\r\nx", "b", &end, 100);
    EXPECT_EQ(end, R::kError);
    // Without a length, a part that grows past the limit fails before its end arrives.
    MultipartParser parser("b", 100);
    std::string head = "--b\r\nContent-Type: image/jpeg\r\n\r\n";
    parser.Feed(head.data(), head.size());
    MultipartPart part;
    R r = R::kNeedMore;
    std::string block(1000, 'y');
    for (int i = 0; i < 100 && r == R::kNeedMore; ++i) {
        parser.Feed(block.data(), block.size());
        r = parser.Next(part);
    }
    EXPECT_EQ(r, R::kError);
    // Exactly the limit is fine.
    got = ParseMultipart("--b\r\n\r\n" + std::string(100, 'z') + "\r\n--b--\r\n", "b", &end, 100);
    ASSERT_EQ(got.size(), 1u);
    EXPECT_EQ(got[0].content.size(), 100u);
}

TEST(MultipartParser, RealWorldShapes) {
    R end;
    // A length that is followed by junk before the next delimiter.
    auto got = ParseMultipart("--f\r\nContent-Length: 3\r\n\r\nabcJUNK\r\n--f\r\nContent-Length: 2\r\n\r\nde\r\n", "f", &end);
    ASSERT_EQ(got.size(), 2u);
    EXPECT_EQ(got[0].content, "abc");
    EXPECT_EQ(got[1].content, "de");
    // Trailing blanks on the delimiter line; headers in any case; a preamble.
    got = ParseMultipart("preamble text\r\n--f  \r\ncontent-length: 1\r\n\r\nq\r\n--f--", "f", &end);
    ASSERT_EQ(got.size(), 1u);
    EXPECT_EQ(got[0].content, "q");
    EXPECT_EQ(got[0].headers, "content-length: 1");
    EXPECT_EQ(end, R::kEnd);
    // A delimiter-like line inside the content that only starts with the boundary.
    got = ParseMultipart("--f\r\n\r\nab\r\n--fx\r\ncd\r\n--f\r\n\r\nz\r\n--f--\r\n", "f", &end);
    ASSERT_EQ(got.size(), 2u);
    EXPECT_EQ(got[0].content, "ab\r\n--fx\r\ncd");
    // No boundary anywhere and no delimiter before the first part: lengths carry it.
    got = ParseMultipart("Content-Type: image/jpeg\r\nContent-Length: 2\r\n\r\nAB\r\n--learned\r\n"
                         "Content-Length: 1\r\n\r\nC\r\n", "", &end);
    ASSERT_EQ(got.size(), 2u);
    EXPECT_EQ(got[1].content, "C");
}

TEST(MultipartBoundary, FromContentType) {
    EXPECT_EQ(MultipartBoundary("multipart/x-mixed-replace; boundary=frame"), "frame");
    EXPECT_EQ(MultipartBoundary("multipart/x-mixed-replace;boundary=--myboundary"), "--myboundary");
    EXPECT_EQ(MultipartBoundary("multipart/x-mixed-replace; charset=x; BOUNDARY=\"a b;c\""), "a b;c");
    EXPECT_EQ(MultipartBoundary("multipart/x-mixed-replace"), "");
    EXPECT_EQ(MultipartBoundary("multipart/x-mixed-replace; boundary="), "");
}

}  // namespace
