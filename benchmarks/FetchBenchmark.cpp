// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <fcntl.h>
#include <spawn.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <zlib.h>

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "Ratios.h"
#include "helper/lasd/HttpFetcher.h"
#include "platform/base/UniqueFd.h"
#include "platform/gzip/fakes/GzipOf.h"
#include "platform/gzip/linux/ZlibGunzip.h"
#include "platform/network/linux/NetworkAnswers.h"
#include "platform/network/linux/RemoteWebClient.h"
#include "platform/runloop/linux/SystemQueues.h"
#include "platform/web/fakes/HttpsServer.h"
#include "platform/worker/linux/WorkerProgram.h"

// What an update costs beside the least it could: a fetch of 100 MiB over TLS beside the curl program,
// whole processes all, the worker that ours starts included, and gunzipping 200 MiB into a file beside a bare
// zlib loop that does the same. Processor time of all threads. The server is an nginx of our own on the
// loopback interface, in another process.
namespace brenvik {
namespace {

constexpr std::size_t kFetchSize = std::size_t{100} << 20;
constexpr std::size_t kUnpackedSize = std::size_t{200} << 20;
// This program's own argument for being the process that fetches.
constexpr const char kFetchOnce[] = "--fetch-once";
constexpr const char kWorker[] = "FetchWorker";

void require(bool holds, const char* what) {
  if (holds) return;
  std::fprintf(stderr, "%s\n", what);
  std::exit(2);
}

double seconds(const timeval& time) {
  return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_usec) / 1e6;
}
double processorTime(const rusage& usage) { return seconds(usage.ru_utime) + seconds(usage.ru_stime); }
double ownProcessorTime() {
  rusage usage{};
  require(::getrusage(RUSAGE_SELF, &usage) == 0, "getrusage");
  return processorTime(usage);
}

class Folder {
 public:
  Folder() {
    std::string name = std::filesystem::temp_directory_path() / "fetch-benchmark.XXXXXX";
    require(::mkdtemp(name.data()) != nullptr, "mkdtemp");
    path = name;
    // The worker, which is no more than anybody once it runs, reads its authority there.
    std::filesystem::permissions(path, std::filesystem::perms(0755));
  }
  ~Folder() { std::filesystem::remove_all(path); }
  std::filesystem::path path;
};

pid_t spawn(std::vector<std::string> words) {
  std::vector<char*> arguments;
  for (std::string& word : words) arguments.push_back(word.data());
  arguments.push_back(nullptr);
  pid_t pid = 0;
  require(::posix_spawnp(&pid, arguments[0], nullptr, nullptr, arguments.data(), environ) == 0,
          words[0].c_str());
  return pid;
}

// Text of which gzip leaves about a third, as it does of a database.
std::string someText(std::size_t size) {
  std::string text;
  text.reserve(size);
  unsigned state = 7;
  while (text.size() < size) {
    state = state * 1664525 + 1013904223;
    text += "cell ";
    text += std::to_string(state >> 12);
    text += '\n';
  }
  text.resize(size);
  return text;
}

class WebServer {
 public:
  explicit WebServer(const std::filesystem::path& folder) : identity_(authority_, "DNS:localhost") {
    authority_.writeCertificate(folder / "authority.pem");
    std::filesystem::copy_file(BRENVIK_FETCH_WORKER, folder / kWorker);
    identity_.writeCertificate(folder / "server.pem");
    identity_.writeKey(folder / "server.key");
    std::ofstream(folder / "body") << someText(kFetchSize);
    // A free port, taken for a moment so that nginx can be told its number.
    port_ = HttpsServer([](HttpsServer::Connection&) {}, HttpsServer::Wire::plain).port();
    const std::string f = folder;
    std::ofstream(folder / "nginx.conf")
        << "daemon off; master_process off; pid " << f << "/pid; error_log " << f
        << "/error.log;\nevents {}\nhttp {\n"
        << "access_log off; client_body_temp_path " << f << "/t1; proxy_temp_path " << f << "/t2;\n"
        << "fastcgi_temp_path " << f << "/t3; uwsgi_temp_path " << f << "/t4; scgi_temp_path " << f
        << "/t5;\n"
        << "server { listen 127.0.0.1:" << port_ << " ssl; ssl_certificate " << f << "/server.pem;\n"
        << "ssl_certificate_key " << f << "/server.key; root " << f << "; } }\n";
    pid_ = spawn({"nginx", "-e", f + "/error.log", "-c", f + "/nginx.conf"});
    for (int i = 0; i < 500 && !std::filesystem::exists(folder / "pid"); ++i) {
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    require(std::filesystem::exists(folder / "pid"), "nginx does not start");
  }
  ~WebServer() {
    ::kill(pid_, SIGTERM);
    ::waitpid(pid_, nullptr, 0);
  }
  std::string url() const { return "https://localhost:" + std::to_string(port_) + "/body"; }

 private:
  Identity authority_;
  Identity identity_;
  std::uint16_t port_ = 0;
  pid_t pid_ = 0;
};

const Folder& folder() {
  static const Folder made;
  return made;
}
WebServer* webServer = nullptr;

// What a process of ours does that is started for one fetch: it starts the worker, which does the work.
void fetchOnce(const std::string& url, const std::string& workers) {
  const auto loop = SystemRunLoop::make();
  SystemQueues queues(*loop);
  WorkerProgram worker(
      {.service = "none", .program = kWorker, .bootstrap = "/nonexistent", .folders = {workers}});
  NetworkAnswers answers(queues, worker);
  RemoteWebClient client(answers);
  ZlibGunzip gunzip;
  HttpFetcher fetcher({queues, client, gunzip});
  require(fetcher.fetch(url, WifiOnly::yes), "the fetch failed");
  require(fetcher.bodyAsData().size() == kFetchSize, "the body is not whole");
}

// Processor time of one whole process, its start and all of its threads included.
double processorTimeOf(std::vector<std::string> words) {
  const std::string name = words[0];
  const pid_t pid = spawn(std::move(words));
  int status = 0;
  rusage usage{};
  require(::wait4(pid, &status, 0, &usage) == pid && status == 0, name.c_str());
  return processorTime(usage);
}

void fetchIntoMemory(benchmark::State& state) {
  for (auto _ : state)
    state.SetIterationTime(processorTimeOf({"/proc/self/exe", kFetchOnce, webServer->url(), folder().path}));
}

double processorTimeOfCurl(const std::string& output) {
  return processorTimeOf({"curl", "-q", "-s", "-S", "--http1.1", "--cacert", folder().path / "authority.pem",
                          "-o", output, webServer->url()});
}

// Throws the body away.
void fetchByCurl(benchmark::State& state) {
  for (auto _ : state) state.SetIterationTime(processorTimeOfCurl("/dev/null"));
}

// Does the same work as ours: the body ends up in memory, here that of a file, and is given back, which ours
// does when its process ends.
void fetchIntoMemoryByCurl(benchmark::State& state) {
  const std::string file = "/dev/shm/fetch-benchmark." + std::to_string(::getpid());
  for (auto _ : state) {
    const double fetched = processorTimeOfCurl(file);
    const double before = ownProcessorTime();
    require(::unlink(file.c_str()) == 0, "unlink");
    state.SetIterationTime(fetched + ownProcessorTime() - before);
  }
}

// One gzip file, made once.
const std::string& packed() {
  static const std::string made = gzipOf(someText(kUnpackedSize));
  return made;
}

void gunzipIntoAFile(benchmark::State& state) {
  const std::string& input = packed();
  ZlibGunzip gunzip;
  for (auto _ : state) {
    const double before = ownProcessorTime();
    const UniqueFd file(
        ::open((folder().path / "ours").c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
    const auto result =
        gunzip.gunzip(std::as_bytes(std::span(input)), kUnpackedSize, [&](std::span<const std::byte> piece) {
          return ::write(file.get(), piece.data(), piece.size()) == static_cast<ssize_t>(piece.size());
        });
    require(result == GunzipResult::whole, "gunzip failed");
    state.SetIterationTime(ownProcessorTime() - before);
  }
}

void bareZlibLoop(benchmark::State& state) {
  const std::string& input = packed();
  std::vector<unsigned char> output(256 * 1024);
  for (auto _ : state) {
    const double before = ownProcessorTime();
    const UniqueFd file(
        ::open((folder().path / "bare").c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
    z_stream stream{};
    require(::inflateInit2(&stream, 15 + 16) == Z_OK, "zlib");
    stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(input.data()));
    stream.avail_in = static_cast<uInt>(input.size());
    int result = Z_OK;
    do {
      stream.next_out = output.data();
      stream.avail_out = static_cast<uInt>(output.size());
      result = ::inflate(&stream, Z_NO_FLUSH);
      const std::size_t size = output.size() - stream.avail_out;
      require(::write(file.get(), output.data(), size) == static_cast<ssize_t>(size), "write");
    } while (result == Z_OK);
    require(result == Z_STREAM_END, "inflate failed");
    ::inflateEnd(&stream);
    state.SetIterationTime(ownProcessorTime() - before);
  }
}

BENCHMARK(fetchIntoMemory)->UseManualTime()->Unit(benchmark::kMillisecond);
BENCHMARK(fetchByCurl)->UseManualTime()->Unit(benchmark::kMillisecond);
BENCHMARK(fetchIntoMemoryByCurl)->UseManualTime()->Unit(benchmark::kMillisecond);
BENCHMARK(gunzipIntoAFile)->UseManualTime()->Unit(benchmark::kMillisecond);
BENCHMARK(bareZlibLoop)->UseManualTime()->Unit(benchmark::kMillisecond);

}  // namespace
}  // namespace brenvik

int main(int argc, char** argv) {
  using namespace brenvik;
  if (argc == 4 && argv[1] == std::string_view(kFetchOnce)) {
    fetchOnce(argv[2], argv[3]);
    return 0;
  }
  folder();
  WebServer server(folder().path);
  webServer = &server;
  return runAndCompare(argc, argv,
                       {{"100 MiB into memory / curl, too", "fetchIntoMemory", "fetchIntoMemoryByCurl", 1.05},
                        {"200 MiB gunzipped / bare zlib", "gunzipIntoAFile", "bareZlibLoop", 1.05}});
}
