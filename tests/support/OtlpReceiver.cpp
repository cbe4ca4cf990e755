#include "support/OtlpReceiver.h"

#include <google/protobuf/util/json_util.h>
#include <zlib.h>

#include <cctype>
#include <sstream>

#include "opentelemetry/proto/collector/logs/v1/logs_service.pb.h"

namespace {

// The headers of `head`, names in lower case; the request line says nothing the tests ask about.
OtlpReceiver::Request ParseHead(const std::string& head) {
  OtlpReceiver::Request request;
  std::istringstream lines(head);
  std::string line;
  std::getline(lines, line);
  while (std::getline(lines, line)) {
    size_t colon = line.find(':');
    if (colon == std::string::npos) continue;
    std::string name = line.substr(0, colon);
    for (char& c : name) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    // "Name: value\r"
    request.headers[name] = line.substr(colon + 2, line.size() - colon - 3);
  }
  return request;
}

std::string Response(int status, const std::string& retryAfter) {
  std::string extra = retryAfter.empty() ? "" : "Retry-After: " + retryAfter + "\r\n";
  std::string body = status == 200 ? "{}" : "";
  return "HTTP/1.1 " + std::to_string(status) + " Test\r\n" + extra +
         "Content-Length: " + std::to_string(body.size()) + "\r\n\r\n" + body;
}

// A gzip body decompressed ("" when it is not gzip).
std::string Gunzip(const std::string& zipped) {
  z_stream stream{};
  inflateInit2(&stream, 15 + 16);
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(zipped.data()));
  stream.avail_in = static_cast<uInt>(zipped.size());
  std::string out;
  int status = Z_OK;
  while (status == Z_OK) {
    char chunk[16384];
    stream.next_out = reinterpret_cast<Bytef*>(chunk);
    stream.avail_out = sizeof chunk;
    status = inflate(&stream, Z_NO_FLUSH);
    out.append(chunk, sizeof chunk - stream.avail_out);
  }
  inflateEnd(&stream);
  return status == Z_STREAM_END ? out : "";
}

}  // namespace

// One accepted connection: reads requests one after another until the peer closes it.
class OtlpReceiver::Connection : public std::enable_shared_from_this<Connection> {
 public:
  Connection(OtlpReceiver& receiver, asio::ip::tcp::socket socket)
      : receiver_(receiver), socket_(std::move(socket)) {}

  void readHead() {
    asio::async_read_until(socket_, buffer_, "\r\n\r\n",
                           [self = shared_from_this()](std::error_code error, size_t bytes) {
                             if (!error) self->onHead(bytes);
                           });
  }

 private:
  void onHead(size_t bytes) {
    std::string head(asio::buffers_begin(buffer_.data()),
                     asio::buffers_begin(buffer_.data()) + static_cast<std::ptrdiff_t>(bytes));
    buffer_.consume(bytes);
    request_ = ParseHead(head);
    size_t length = std::strtoull(request_.headers["content-length"].c_str(), nullptr, 10);
    size_t missing = length > buffer_.size() ? length - buffer_.size() : 0;
    asio::async_read(socket_, buffer_, asio::transfer_exactly(missing),
                     [self = shared_from_this(), length](std::error_code error, size_t) {
                       if (!error) self->onBody(length);
                     });
  }

  void onBody(size_t length) {
    auto begin = asio::buffers_begin(buffer_.data());
    request_.body.assign(begin, begin + static_cast<std::ptrdiff_t>(length));
    buffer_.consume(length);
    Answer answer = receiver_.judge(request_);
    if (answer.status == 0) {
      std::error_code ignored;
      socket_.close(ignored);
      return;
    }
    response_ = Response(answer.status, answer.retryAfter);
    timer_.expires_after(answer.delay);
    timer_.async_wait([self = shared_from_this()](std::error_code) {
      asio::async_write(self->socket_, asio::buffer(self->response_),
                        [self](std::error_code error, size_t) {
                          if (!error) self->readHead();
                        });
    });
  }

  OtlpReceiver& receiver_;
  asio::ip::tcp::socket socket_;
  asio::steady_timer timer_{socket_.get_executor()};
  asio::streambuf buffer_;
  Request request_;
  std::string response_;
};

OtlpReceiver::OtlpReceiver() {
  accept();
  thread_ = std::thread([this] { io_.run(); });
}

OtlpReceiver::~OtlpReceiver() {
  io_.stop();
  thread_.join();
}

std::string OtlpReceiver::endpoint() const {
  return "http://127.0.0.1:" + std::to_string(acceptor_.local_endpoint().port()) + "/v1/logs";
}

void OtlpReceiver::accept() {
  acceptor_.async_accept([this](std::error_code error, asio::ip::tcp::socket socket) {
    if (error) return;
    std::make_shared<Connection>(*this, std::move(socket))->readHead();
    accept();
  });
}

OtlpReceiver::Answer OtlpReceiver::judge(Request request) {
  SXMutexLock lock(mutex_);
  Answer answer{200, "", delay_};
  if (request.headers["content-encoding"] == "gzip") request.body = Gunzip(request.body);
  if (faultsLeft_ > 0) {
    --faultsLeft_;
    answer = {fault_.status, fault_.retryAfter, delay_};
  }
  request.status = answer.status;
  requests_.push_back(std::move(request));
  return answer;
}

void OtlpReceiver::failNext(size_t count, int status, std::string retryAfter) {
  SXMutexLock lock(mutex_);
  faultsLeft_ = count;
  fault_ = {status, std::move(retryAfter)};
}

void OtlpReceiver::answerAfter(std::chrono::milliseconds delay) {
  SXMutexLock lock(mutex_);
  delay_ = delay;
}

std::vector<OtlpReceiver::Request> OtlpReceiver::requests() const {
  SXMutexLock lock(mutex_);
  return requests_;
}

std::vector<SXValue> OtlpReceiver::acceptedRecords() const {
  std::vector<SXValue> records;
  for (const Request& request : requests()) {
    if (request.status != 200) continue;
    // The exporter sends one resource with one scope.
    const SXValue body = json(request);
    for (SXValue record : body["resourceLogs"][0]["scopeLogs"][0]["logRecords"]) {
      const SXValue attributes = record["attributes"];
      for (const SXValue& attribute : attributes) {
        const SXValue& value = attribute["value"];
        if (!value.empty()) record["attrs"][attribute["key"].get<std::string>()] = *value.begin();
      }
      records.push_back(std::move(record));
    }
  }
  return records;
}

SXValue OtlpReceiver::json(const Request& request) {
  if (request.headers.at("content-type") != "application/x-protobuf") {
    return SXValue::parse(request.body);
  }
  opentelemetry::proto::collector::logs::v1::ExportLogsServiceRequest message;
  std::string text;
  message.ParseFromString(request.body);
  (void)google::protobuf::util::MessageToJsonString(message, &text);
  return SXValue::parse(text);
}
