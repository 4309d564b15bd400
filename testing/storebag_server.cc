#include "testing/storebag_server.h"

#include <stdexcept>

#include "formats/document.h"
#include "tools/storebag/signed_storebag.h"

namespace tarnel::test {
namespace {

StorebagKey generated() {
  auto key = StorebagKey::generate(2048);
  if (!key) throw std::runtime_error(key.error().localizedDescription());
  return *std::move(key);
}

// "GET /name?version=8.0 HTTP/1.1" to "name".
std::string nameIn(const std::string& request) {
  const size_t end = request.find_first_of("? ", 5);
  const size_t slash = request.rfind('/', end);
  return request.substr(slash + 1, end - slash - 1);
}

}  // namespace

const StorebagKey& StorebagServer::key() {
  static const StorebagKey key = generated();
  return key;
}

const StorebagKey& StorebagServer::foreignKey() {
  static const StorebagKey key = generated();
  return key;
}

std::string StorebagServer::sign(std::string_view inner, const StorebagKey& with) {
  auto outer = makeSignedStorebag(inner, with);
  if (!outer) throw std::runtime_error(outer.error().localizedDescription());
  return *std::move(outer);
}

StorebagServer::StorebagServer(std::optional<TlsIdentity> identity)
    : server_(
          [this](RawConnection& connection) {
            while (const auto request = connection.readRequest()) {
              if (!answerRequest(connection, *request)) return;
            }
          },
          std::move(identity)) {
  const Data der = key().publicKeyDer();
  bundle_.write("version", "8.0\n");
  bundle_.write("publicKey.der", std::string(der.begin(), der.end()));
}

void StorebagServer::connect(PrivateInstance& instance) const {
  instance.setBundle(bundle_.path());
  instance.setSetting("tarnel_storebag_url", url());
}

void StorebagServer::behave(const std::string& name, Behaviour behaviour) {
  const std::lock_guard lock(mutex_);
  behaviours_[name] = std::move(behaviour);
}

void StorebagServer::say(const std::string& name, const std::string& bytes) {
  behave(name, [bytes](RawConnection& connection, const std::string&) {
    connection.write(bytes);
    return false;
  });
}

void StorebagServer::answer(const std::string& name, const std::string& body,
                            const std::string& headerLines) {
  behave(name, [answer = httpAnswer("200 OK", body, headerLines)](
                   RawConnection& connection, const std::string&) { return connection.write(answer); });
}

void StorebagServer::serve(const std::string& name, const Dictionary& inner) {
  answer(name, sign(writeTextDocument(inner)));
}

int StorebagServer::requests(const std::string& name) const {
  const std::lock_guard lock(mutex_);
  const auto found = requests_.find(name);
  return found == requests_.end() ? 0 : found->second;
}

bool StorebagServer::answerRequest(RawConnection& connection, const std::string& request) {
  Behaviour behaviour;
  {
    const std::lock_guard lock(mutex_);
    const std::string name = nameIn(request);
    ++requests_[name];
    const auto found = behaviours_.find(name);
    if (found != behaviours_.end()) behaviour = found->second;
  }
  if (behaviour) return behaviour(connection, request);
  return connection.write(httpAnswer("404 Not Found", "no such storebag"));
}

}  // namespace tarnel::test
