// IPC figures: a request's round trip over lmo next to a raw AF_UNIX
// ping-pong of the same frame size, and the CBOR codec against libcbor.

#include <benchmark/benchmark.h>
#include <cbor.h>
#include <sys/socket.h>
#include <unistd.h>

#include <condition_variable>
#include <filesystem>
#include <mutex>
#include <thread>

#include "lmo/Cbor.h"
#include "lmo/Connection.h"
#include "lmo/Listener.h"
#include "lmo/Protocol.h"

namespace vantrel::lmo {
namespace {

Dictionary smallRequest() {
  return Dictionary{{protocol::kKeyRequest, Value(protocol::kRequestAnnotate)},
                    {protocol::kKeyVersion, Value::unsignedInteger(protocol::kCurrentVersion)},
                    {protocol::kKeyUuids, Value(Array{})},
                    {protocol::kKeyAnnotations, Value(Dictionary{})}};
}

Dictionary typicalRequest() {
  Array uuids;
  for (int i = 0; i < 4; ++i) uuids = uuids.appending(Value(base::Uuid::random()));
  return Dictionary{{protocol::kKeyRequest, Value(protocol::kRequestMatch)},
                    {protocol::kKeyVersion, Value::unsignedInteger(protocol::kCurrentVersion)},
                    {protocol::kKeyFlags, Value::unsignedInteger(0)},
                    {protocol::kKeyUuids, Value(uuids)},
                    {protocol::kKeyRules,
                     Value(Dictionary{{"QXExtensionPointIdentifier", Value("com.example.share")},
                                      {"NSExtensionActivationRule", Value("TRUEPREDICATE")},
                                      {"count", Value::integer(-12)},
                                      {"ratio", Value::real(0.5)}})}};
}

void BM_LmoRoundTrip(benchmark::State& state) {
  // A fresh path per run: the previous run's listener closes asynchronously.
  static int run = 0;
  std::string path = (std::filesystem::temp_directory_path() /
                      ("vantrel-bench-" + std::to_string(::getpid()) + "-" + std::to_string(++run)))
                         .string();
  auto serverQueue = std::make_shared<base::SerialQueue>("bench-server");
  auto listener = Listener::create(path, serverQueue).value();
  listener->setConnectionHandler([](std::shared_ptr<Connection> c) {
    std::weak_ptr<Connection> weak = c;
    c->setEventHandler([weak](const Event& e) {
      auto connection = weak.lock();
      if (connection == nullptr || e.message() == nullptr) return;
      if (auto reply = createReply(*e.message())) (void)connection->sendReply(*reply);
    });
    c->resume();
  });
  listener->resume();
  auto client = Connection::connectToService(path, std::make_shared<base::SerialQueue>("c"));
  client->setEventHandler([](const Event&) {});
  client->resume();
  auto replyQueue = std::make_shared<base::SerialQueue>("bench-replies");
  std::mutex mutex;
  std::condition_variable cv;
  uint64_t done = 0;
  Dictionary request = smallRequest();
  uint64_t sent = 0;
  for (auto _ : state) {
    ++sent;
    (void)client->sendWithReply(request, replyQueue, [&](const Event&) {
      std::lock_guard lock(mutex);
      ++done;
      cv.notify_one();
    });
    std::unique_lock lock(mutex);
    cv.wait(lock, [&] { return done >= sent; });
  }
  state.counters["frame_bytes"] =
      static_cast<double>(encodeFrame({FrameKind::kRequest, 1, 0, request}).value().size());
  client->cancel();
  listener->cancel();
}
BENCHMARK(BM_LmoRoundTrip)->UseRealTime();

void BM_RawSocketPingPong(benchmark::State& state) {
  std::vector<uint8_t> frame = encodeFrame({FrameKind::kRequest, 1, 0, smallRequest()}).value();
  int fds[2];
  ::socketpair(AF_UNIX, SOCK_STREAM, 0, fds);
  std::thread echo([fd = fds[1], size = frame.size()] {
    std::vector<uint8_t> buffer(size);
    for (;;) {
      size_t got = 0;
      while (got < size) {
        ssize_t n = ::read(fd, buffer.data() + got, size - got);
        if (n <= 0) return;
        got += static_cast<size_t>(n);
      }
      if (::write(fd, buffer.data(), size) != static_cast<ssize_t>(size)) return;
    }
  });
  std::vector<uint8_t> in(frame.size());
  for (auto _ : state) {
    (void)!::write(fds[0], frame.data(), frame.size());
    size_t got = 0;
    while (got < in.size())
      got += static_cast<size_t>(::read(fds[0], in.data() + got, in.size() - got));
  }
  state.counters["frame_bytes"] = static_cast<double>(frame.size());
  ::shutdown(fds[0], SHUT_RDWR);
  echo.join();
  ::close(fds[0]);
  ::close(fds[1]);
}
BENCHMARK(BM_RawSocketPingPong)->UseRealTime();

void BM_CborEncodeLmo(benchmark::State& state) {
  Value request(typicalRequest());
  for (auto _ : state) benchmark::DoNotOptimize(encodeCbor(request).value());
}
BENCHMARK(BM_CborEncodeLmo);

void BM_CborDecodeLmo(benchmark::State& state) {
  std::vector<uint8_t> bytes = encodeCbor(Value(typicalRequest())).value();
  for (auto _ : state) benchmark::DoNotOptimize(decodeCborMessage(bytes.data(), bytes.size()));
}
BENCHMARK(BM_CborDecodeLmo);

// libcbor, used the way the layer would have to use it: lmo::Value to a
// libcbor tree to bytes, and bytes to a libcbor tree to lmo::Value.
cbor_item_t* toLibcbor(const Value& v) {
  switch (v.type()) {
    case Value::Type::kNull:
      return cbor_new_null();
    case Value::Type::kBoolean:
      return cbor_build_bool(*v.getIfBoolean());
    case Value::Type::kInteger:
      if (v.isUnsignedInteger() || *v.getIfInt64() >= 0)
        return cbor_build_uint64(v.unsignedValue());
      return cbor_build_negint64(~static_cast<uint64_t>(*v.getIfInt64()));
    case Value::Type::kReal:
      return cbor_build_float8(*v.getIfReal());
    case Value::Type::kString:
      return cbor_build_stringn(v.getIfString()->data(), v.getIfString()->size());
    case Value::Type::kData:
      return cbor_build_bytestring(v.getIfData()->data(), v.getIfData()->size());
    case Value::Type::kDate:
      return cbor_build_tag(1, cbor_move(cbor_build_float8(v.getIfDate()->secondsSince1970)));
    case Value::Type::kUuid:
      return cbor_build_tag(37,
                            cbor_move(cbor_build_bytestring(v.getIfUuid()->bytes().data(), 16)));
    case Value::Type::kArray: {
      cbor_item_t* a = cbor_new_definite_array(v.getIfArray()->size());
      for (const Value& item : *v.getIfArray()) cbor_array_push(a, cbor_move(toLibcbor(item)));
      return a;
    }
    case Value::Type::kDictionary: {
      cbor_item_t* m = cbor_new_definite_map(v.getIfDictionary()->size());
      for (const auto& [key, item] : *v.getIfDictionary()) {
        cbor_map_add(m, cbor_pair{cbor_move(cbor_build_stringn(key.data(), key.size())),
                                  cbor_move(toLibcbor(item))});
      }
      return m;
    }
  }
  return cbor_new_null();
}

Value fromLibcbor(const cbor_item_t* item) {
  switch (cbor_typeof(item)) {
    case CBOR_TYPE_UINT:
      return Value::unsignedInteger(cbor_get_int(item));
    case CBOR_TYPE_NEGINT:
      return Value::integer(-static_cast<int64_t>(cbor_get_int(item)) - 1);
    case CBOR_TYPE_BYTESTRING:
      return Value::data(cbor_bytestring_handle(item), cbor_bytestring_length(item));
    case CBOR_TYPE_STRING:
      return Value(std::string(reinterpret_cast<const char*>(cbor_string_handle(item)),
                               cbor_string_length(item)));
    case CBOR_TYPE_ARRAY: {
      std::vector<Value> items;
      for (size_t i = 0; i < cbor_array_size(item); ++i) {
        items.push_back(fromLibcbor(cbor_array_handle(item)[i]));
      }
      return Value(Array(std::move(items)));
    }
    case CBOR_TYPE_MAP: {
      std::vector<Dictionary::Entry> entries;
      cbor_pair* pairs = cbor_map_handle(item);
      for (size_t i = 0; i < cbor_map_size(item); ++i) {
        entries.emplace_back(
            std::string(reinterpret_cast<const char*>(cbor_string_handle(pairs[i].key)),
                        cbor_string_length(pairs[i].key)),
            fromLibcbor(pairs[i].value));
      }
      return Value(Dictionary::fromEntries(std::move(entries)));
    }
    case CBOR_TYPE_TAG: {
      cbor_item_t* inner = cbor_tag_item(item);
      Value v = cbor_tag_value(item) == 37
                    ? Value(*base::Uuid::fromBytes(cbor_bytestring_handle(inner), 16))
                    : Value(Date{cbor_float_get_float(inner)});
      cbor_decref(&inner);
      return v;
    }
    case CBOR_TYPE_FLOAT_CTRL:
      if (cbor_float_get_width(item) != CBOR_FLOAT_0)
        return Value::real(cbor_float_get_float(item));
      if (cbor_is_null(item)) return Value();
      if (cbor_is_bool(item)) return Value::boolean(cbor_get_bool(item));
      return Value::real(cbor_float_get_float(item));
  }
  return Value();
}

void BM_CborEncodeLibcbor(benchmark::State& state) {
  Value request(typicalRequest());
  for (auto _ : state) {
    cbor_item_t* item = toLibcbor(request);
    unsigned char* buffer = nullptr;
    size_t size = 0;
    benchmark::DoNotOptimize(cbor_serialize_alloc(item, &buffer, &size));
    free(buffer);
    cbor_decref(&item);
  }
}
BENCHMARK(BM_CborEncodeLibcbor);

void BM_CborDecodeLibcbor(benchmark::State& state) {
  std::vector<uint8_t> bytes = encodeCbor(Value(typicalRequest())).value();
  for (auto _ : state) {
    cbor_load_result result;
    cbor_item_t* item = cbor_load(bytes.data(), bytes.size(), &result);
    benchmark::DoNotOptimize(fromLibcbor(item));
    cbor_decref(&item);
  }
}
BENCHMARK(BM_CborDecodeLibcbor);

}  // namespace
}  // namespace vantrel::lmo
