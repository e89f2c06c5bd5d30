// Sequential GETs and 1 KB form POSTs against a loopback server, through CredRequest::Process
// (a new request each time, as callers use it) and through raw libcurl easy handles configured
// with the same options (a new handle each time). Prints requests per second and the ratio.
// Then a 200 MB download into a response stream, through CredRequest and through a raw easy
// handle writing to the same kind of stream, printing how far each grows the resident set.
//
// Usage: request_bench [requests per round] [rounds]
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <string>
#include <vector>

#include <curl/curl.h>

#include "bench_support.h"
#include "kovacredential/cred_request.h"
#include "simlib/loopback_server.h"

namespace {

using kova_bench::Median;
using kova_bench::StatusKb;

using Clock = std::chrono::steady_clock;

size_t AppendBody(char *data, size_t size, size_t nmemb, void *user) {
    static_cast<std::string *>(user)->append(data, size * nmemb);
    return size * nmemb;
}

// The options CredRequest sets for a plain request with default settings.
bool RawRequest(const std::string &url, const std::string *postBody) {
    CURL *curl = curl_easy_init();
    if (curl == nullptr) {
        return false;
    }
    std::string response;
    curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl, CURLOPT_FOLLOWLOCATION, 1L);
    curl_easy_setopt(curl, CURLOPT_POSTREDIR, static_cast<long>(CURL_REDIR_POST_ALL));
    curl_easy_setopt(curl, CURLOPT_AUTOREFERER, 1L);
    curl_easy_setopt(curl, CURLOPT_USERAGENT, "Velantix-23739");
    curl_easy_setopt(curl, CURLOPT_SSL_VERIFYPEER, 0L);
    curl_easy_setopt(curl, CURLOPT_SSL_VERIFYHOST, 0L);
    curl_easy_setopt(curl, CURLOPT_TCP_KEEPALIVE, 1L);
    curl_easy_setopt(curl, CURLOPT_TCP_KEEPIDLE, 120L);
    curl_easy_setopt(curl, CURLOPT_TCP_KEEPINTVL, 120L);
    curl_easy_setopt(curl, CURLOPT_LOW_SPEED_LIMIT, 1L);
    curl_easy_setopt(curl, CURLOPT_LOW_SPEED_TIME, 120L);
    curl_easy_setopt(curl, CURLOPT_CONNECTTIMEOUT, 120L);
    curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
    if (postBody != nullptr) {
        curl_easy_setopt(curl, CURLOPT_POST, 1L);
        curl_easy_setopt(curl, CURLOPT_COPYPOSTFIELDS, postBody->c_str());
    }
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, AppendBody);
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, &response);
    bool ok = curl_easy_perform(curl) == CURLE_OK;
    long status = 0;
    curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &status);
    curl_easy_cleanup(curl);
    return ok && status == 200 && !response.empty();
}

bool KovaRequest(const std::string &url, const std::string *postValue) {
    KOVA::CredRequest req;
    req.SetURL(url);
    if (postValue != nullptr) {
        req.AddPostParam("data", *postValue);
    }
    return req.Process(true, 0) && !req.GetResponse().empty();
}

template <typename Fn>
double Seconds(int n, Fn fn, int &failures) {
    const auto start = Clock::now();
    for (int i = 0; i < n; ++i) {
        if (!fn()) {
            ++failures;
        }
    }
    return std::chrono::duration<double>(Clock::now() - start).count();
}

constexpr size_t kDownloadBytes = 200u << 20;

// How far `download` (which writes into the stream it is given) raises the peak resident set
// above the resident set before it, in kB; -1 when the download fails or comes up short.
template <typename Fn>
long PeakGrowthKb(const std::string &path, Fn download) {
    FILE *stream = fopen(path.c_str(), "w+");
    if (stream == nullptr) {
        return -1;
    }
    // "5" resets the peak to the present resident set.
    FILE *clear = fopen("/proc/self/clear_refs", "w");
    if (clear == nullptr || fputs("5", clear) < 0 || fclose(clear) != 0) {
        fclose(stream);
        return -1;
    }
    const long before = StatusKb("VmRSS");
    const bool ok = download(stream);
    const long peak = StatusKb("VmHWM");
    fflush(stream);
    struct stat st;
    const bool complete =
        fstat(fileno(stream), &st) == 0 && static_cast<size_t>(st.st_size) == kDownloadBytes;
    fclose(stream);
    unlink(path.c_str());
    return ok && complete && before >= 0 && peak >= 0 ? peak - before : -1;
}

bool KovaDownload(const std::string &url, FILE *stream) {
    KOVA::CredRequest req;
    return req.SetURL(url) && req.SetRespStream(stream) && req.Process(true, 0);
}

bool RawDownload(const std::string &url, FILE *stream) {
    CURL *curl = curl_easy_init();
    if (curl == nullptr) {
        return false;
    }
    curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, stream);  // libcurl's own writer: fwrite
    long status = 0;
    const bool ok = curl_easy_perform(curl) == CURLE_OK &&
                    curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &status) == CURLE_OK &&
                    status == 200;
    curl_easy_cleanup(curl);
    return ok;
}

// A 200 MB body sent from one reused 1 MB block, so that the server's side stays small.
void ServeDownload(kovasim::RawServer::Connection &conn) {
    static const std::string block(1u << 20, 'd');
    if (!conn.Send("HTTP/1.1 200 OK\r\nContent-Length: " + std::to_string(kDownloadBytes) +
                   "\r\nConnection: close\r\n\r\n")) {
        return;
    }
    for (size_t sent = 0; sent < kDownloadBytes && conn.Send(block); sent += block.size()) {
    }
}

// Prints the resident-set growth of a 200 MB download into a stream; false on failure.
bool MeasureDownloadMemory() {
    kovasim::RawServer server(ServeDownload);
    char dir[] = "/tmp/request_bench.XXXXXX";
    if (!server.Start() || mkdtemp(dir) == nullptr) {
        fprintf(stderr, "cannot start the download server\n");
        return false;
    }
    const std::string url = server.BaseUrl() + "/download";
    const std::string path = std::string(dir) + "/body";
    // One download each first, so that what libcurl and the library set up once per process
    // is not counted against either side.
    const long warmKova = PeakGrowthKb(path, [&](FILE *s) { return KovaDownload(url, s); });
    const long warmRaw = PeakGrowthKb(path, [&](FILE *s) { return RawDownload(url, s); });
    const long kova = PeakGrowthKb(path, [&](FILE *s) { return KovaDownload(url, s); });
    const long raw = PeakGrowthKb(path, [&](FILE *s) { return RawDownload(url, s); });
    server.Stop();
    rmdir(dir);
    if (warmKova < 0 || warmRaw < 0 || kova < 0 || raw < 0) {
        fprintf(stderr, "a 200 MB download failed\n");
        return false;
    }
    printf("\n200 MB download into a response stream: peak resident set grows by\n");
    printf("%-14s %8ld kB (first download of the process: %ld kB)\n", "CredRequest", kova,
           warmKova);
    printf("%-14s %8ld kB (first download of the process: %ld kB)\n", "raw libcurl", raw, warmRaw);
    printf("target: CredRequest grows by less than 10 MB: %s\n",
           kova < 10 * 1024 ? "met" : "NOT met");
    return true;
}

}  // namespace

int main(int argc, char **argv) {
    const int perRound = argc > 1 ? atoi(argv[1]) : 200;
    const int rounds = argc > 2 ? atoi(argv[2]) : 40;
    if (perRound <= 0 || rounds <= 0) {
        fprintf(stderr, "usage: %s [requests per round] [rounds]\n", argv[0]);
        return 2;
    }
    curl_global_init(CURL_GLOBAL_DEFAULT);

    kovasim::LoopbackServer server;
    server.Route("*", "/bench", [](const httplib::Request &req, httplib::Response &res) {
        res.set_content(
            req.method == "POST" ? "{\"success\":true,\"posted\":true}" : "{\"success\":true}",
            "application/json");
    });
    if (!server.Start()) {
        fprintf(stderr, "cannot start the loopback server: %s\n", server.Error().c_str());
        return 1;
    }
    const std::string url = server.BaseUrl() + "/bench";
    const std::string value(1024 - 5, 'v');  // "data=" plus the value make 1 KB
    const std::string body = "data=" + value;

    // Rounds alternate between the two clients so that drift of the machine hits both alike;
    // the ratio is the median of the rounds' ratios, which a stray slow round cannot move.
    double kovaGet = 0, rawGet = 0, kovaPost = 0, rawPost = 0;
    std::vector<double> getRatios, postRatios;
    int failures = 0;
    for (int r = 0; r < rounds; ++r) {
        const double rg = Seconds(
            perRound, [&] { return RawRequest(url, nullptr); }, failures);
        const double kg = Seconds(
            perRound, [&] { return KovaRequest(url, nullptr); }, failures);
        const double rp = Seconds(
            perRound, [&] { return RawRequest(url, &body); }, failures);
        const double kp = Seconds(
            perRound, [&] { return KovaRequest(url, &value); }, failures);
        rawGet += rg;
        kovaGet += kg;
        rawPost += rp;
        kovaPost += kp;
        getRatios.push_back(rg / kg);
        postRatios.push_back(rp / kp);
    }
    server.Stop();

    const double n = static_cast<double>(perRound) * rounds;
    printf("%d sequential requests of each kind (%d rounds of %d), loopback HTTP\n",
           static_cast<int>(n), rounds, perRound);
    printf("%-14s %14s %14s %14s\n", "", "CredRequest/s", "raw libcurl/s", "median ratio");
    printf("%-14s %14.0f %14.0f %14.3f\n", "GET", n / kovaGet, n / rawGet, Median(getRatios));
    printf("%-14s %14.0f %14.0f %14.3f\n", "POST 1 KB form", n / kovaPost, n / rawPost,
           Median(postRatios));
    if (failures > 0) {
        printf("failed requests: %d\n", failures);
        return 1;
    }
    const bool measured = MeasureDownloadMemory();
    curl_global_cleanup();
    return measured ? 0 : 1;
}
