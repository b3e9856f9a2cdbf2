#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <string>

#include "tests/server/ServerTest.h"

namespace tamber::testing {
namespace {

// Sends `head` and the first `sent` bytes of a body on a raw connection and returns the
// status line of the answer: what a client that is told off before it finished sees.
std::string statusLineFor(int port, const std::string& head, size_t sent) {
    int fd = ::socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(static_cast<uint16_t>(port));
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    if (::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
        ::close(fd);
        return "";
    }
    timeval patience{30, 0};
    ::setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
    std::string request = head + std::string(sent, 'a');
    (void)::send(fd, request.data(), request.size(), MSG_NOSIGNAL);
    std::string answer;
    char buffer[1024];
    ssize_t got = 0;
    while (answer.find("\r\n") == std::string::npos &&
           (got = ::recv(fd, buffer, sizeof buffer, 0)) > 0)
        answer.append(buffer, static_cast<size_t>(got));
    ::close(fd);
    return answer.substr(0, answer.find("\r\n"));
}

class AccessControlTest : public ServerTest {
protected:
    std::string hostHeader() const { return "127.0.0.1:" + std::to_string(server->port()); }
};

TEST_F(AccessControlTest, EveryApiRequestNeedsTheRightTokenInAHeader) {
    EXPECT_EQ(status(anonymous()->Get("/api/v1/status")), 401);

    auto wrong = anonymous();
    wrong->set_bearer_token_auth(server->token().substr(1) + "0");
    EXPECT_EQ(status(wrong->Get("/api/v1/status")), 401);
    auto shorter = anonymous();
    shorter->set_bearer_token_auth(server->token().substr(0, 10));
    EXPECT_EQ(status(shorter->Get("/api/v1/status")), 401);

    // The right token in the URL is refused too, also together with a good header.
    auto inQuery = anonymous()->Get("/api/v1/status?token=" + server->token());
    EXPECT_EQ(status(inQuery), 401);
    EXPECT_EQ(status(client()->Get("/api/v1/status?token=" + server->token())), 401);
    EXPECT_EQ(status(client()->Get("/api/v1/status?x=" + server->token())), 401);

    auto good = client()->Get("/api/v1/status");
    ASSERT_EQ(status(good), 200);
    EXPECT_EQ(body(good)["storage"], storage);
    // A refusal is the error object and never echoes the token.
    auto refused = anonymous()->Get("/api/v1/status");
    EXPECT_TRUE(body(refused).contains("error"));
    EXPECT_EQ(refused->body.find(server->token()), std::string::npos);
}

TEST_F(AccessControlTest, SessionCookieIsGivenOnlyForTheBearerToken) {
    auto cookieFrom = [](const httplib::Result& result) {
        return result ? result->get_header_value("Set-Cookie") : std::string();
    };
    auto session = client()->Post("/api/v1/session");
    ASSERT_EQ(status(session), 200);
    std::string cookie = cookieFrom(session);
    EXPECT_NE(cookie.find("HttpOnly"), std::string::npos);
    EXPECT_NE(cookie.find("SameSite=Strict"), std::string::npos);
    EXPECT_NE(cookie.find("Path=/"), std::string::npos);
    std::string pair = cookie.substr(0, cookie.find(';'));

    // The cookie alone now opens the API...
    EXPECT_EQ(status(anonymous()->Get("/api/v1/status", {{"Cookie", "other=1; " + pair}})), 200);
    // ...but a forged one does not, and the cookie cannot be traded for a new session.
    EXPECT_EQ(status(anonymous()->Get("/api/v1/status", {{"Cookie", pair + "x"}})), 401);
    EXPECT_EQ(status(anonymous()->Post("/api/v1/session", {{"Cookie", pair}}, "", "")), 401);
    EXPECT_EQ(status(anonymous()->Post("/api/v1/session")), 401);
}

TEST_F(AccessControlTest, ForeignHostOrOriginIsRefused) {
    // A DNS-rebinding page talks to 127.0.0.1 but sends its own name.
    EXPECT_EQ(status(client()->Get("/api/v1/status",
                                   {{"Host", "evil.example:" + std::to_string(server->port())}})),
              403);
    EXPECT_EQ(status(client()->Get("/api/v1/status", {{"Host", "127.0.0.1:1"}})), 403);
    EXPECT_EQ(status(anonymous()->Get("/", {{"Host", "evil.example"}})), 403);
    EXPECT_EQ(status(client()->Get("/api/v1/status",
                                   {{"Host", "localhost:" + std::to_string(server->port())}})),
              200);
    EXPECT_EQ(status(client()->Get("/api/v1/status",
                                   {{"Host", "[::1]:" + std::to_string(server->port())}})),
              200);

    // A write from another origin changes nothing; from the server's own origin it works.
    auto foreign = client()->Post("/api/v1/containers/" + idOf("box") + "/children",
                                  {{"Origin", "http://evil.example"}}, R"({"folder": "Evil"})",
                                  "application/json");
    EXPECT_EQ(status(foreign), 403);
    auto lookalike = client()->Post("/api/v1/containers/" + idOf("box") + "/children",
                                    {{"Origin", "http://" + hostHeader() + ".evil.example"}},
                                    R"({"folder": "Evil"})", "application/json");
    EXPECT_EQ(status(lookalike), 403);
    EXPECT_FALSE(std::filesystem::exists(storage + "/box/Evil"));
    auto own = client()->Post("/api/v1/containers/" + idOf("box") + "/children",
                              {{"Origin", "http://" + hostHeader()}}, R"({"folder": "Mine"})",
                              "application/json");
    EXPECT_EQ(status(own), 200) << (own ? own->body : "");
    EXPECT_TRUE(std::filesystem::is_directory(storage + "/box/Mine"));
    // A read may come from anywhere that holds the token.
    EXPECT_EQ(status(client()->Get("/api/v1/status", {{"Origin", "http://evil.example"}})), 200);
}

TEST_F(AccessControlTest, OversizedAndMalformedBodiesAreRefused) {
    std::string folder = "/api/v1/containers/" + idOf("box") + "/children";
    // A declared body past the limit is refused before it is read.
    std::string head = "POST " + folder +
                       " HTTP/1.1\r\nHost: 127.0.0.1:" + std::to_string(server->port()) +
                       "\r\nAuthorization: Bearer " + server->token() +
                       "\r\nContent-Type: application/json\r\nContent-Length: " +
                       std::to_string(AccessControl::kMaxJsonBytes + 1) + "\r\n\r\n";
    EXPECT_EQ(statusLineFor(server->port(), head, 100), "HTTP/1.1 413 Payload Too Large");
    // One that does not say its length is cut off at the limit.
    std::string huge = R"({"folder": ")" + std::string(AccessControl::kMaxJsonBytes, 'a') + R"("})";
    size_t offered = 0;
    auto chunked = client()->Post(
        folder,
        [&](size_t, httplib::DataSink& sink) {
            size_t piece = std::min<size_t>(65536, huge.size() - offered);
            sink.write(huge.data() + offered, piece);
            offered += piece;
            if (offered == huge.size())
                sink.done();
            return true;
        },
        "application/json");
    EXPECT_TRUE(status(chunked) == 413 || status(chunked) == -1) << status(chunked);
    EXPECT_EQ(status(client()->Post(folder, "{\"folder\": ", "application/json")), 400);
    EXPECT_EQ(status(client()->Post(folder, "[1, 2]", "application/json")), 400);
    EXPECT_EQ(status(client()->Post(folder, std::string("\xff\xfe{", 3), "application/json")), 400);
    EXPECT_EQ(status(postJson(folder, {{"folder", 7}})), 400);
    EXPECT_EQ(status(postJson(folder, {{"folder", "a"}, {"import", "/x"}})), 400);
    EXPECT_TRUE(std::filesystem::is_empty(storage + "/box"));

    // Headers past the limit, even when each line is short.
    httplib::Headers many;
    for (int i = 0; i < 20; ++i)
        many.emplace("X-Filler-" + std::to_string(i), std::string(4000, 'x'));
    auto crowded = client()->Get("/api/v1/status", many);
    EXPECT_EQ(status(crowded), 431);
}

TEST_F(AccessControlTest, UnknownRoutesAnswerTheErrorObject) {
    auto missing = client()->Get("/api/v1/no-such-thing");
    EXPECT_EQ(status(missing), 404);
    EXPECT_TRUE(body(missing)["error"].contains("message"));
    EXPECT_EQ(status(client()->Get("/")), 200);
}

}  // namespace
}  // namespace tamber::testing
