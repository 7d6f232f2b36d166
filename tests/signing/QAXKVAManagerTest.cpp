#include "signing/QAXKVAManager.h"

#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <openssl/x509_vfy.h>
#include <openssl/x509v3.h>
#include <sys/stat.h>
#include <zlib.h>

#include <atomic>
#include <chrono>
#include <future>

#include "core/Base64.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "fakes/FakeAttestation.h"
#include "fakes/FakeServices.h"
#include "fakes/TestPlatform.h"
#include "platform/HttpClient.h"
#include "platform/host/HostAttestationService.h"
#include "signing/AccountHeaders.h"

namespace qax {
namespace {

using Step = test::ScriptedAttestationService::Step;

constexpr const char* kBody =
    R"({"locale":"en_US","requestTimestamp":1700000000000,"requestTimezone":0,"serialNumber":"C02TESTSERIAL"})";

// Inflates a raw DEFLATE stream.
std::optional<std::string> inflateRaw(const std::vector<std::uint8_t>& in) {
    z_stream s{};
    if (inflateInit2(&s, -MAX_WBITS) != Z_OK) {
        return std::nullopt;
    }
    std::string out(1 << 20, '\0');
    s.next_in = const_cast<Bytef*>(in.data());
    s.avail_in = static_cast<uInt>(in.size());
    s.next_out = reinterpret_cast<Bytef*>(out.data());
    s.avail_out = static_cast<uInt>(out.size());
    int rc = inflate(&s, Z_FINISH);
    out.resize(s.total_out);
    inflateEnd(&s);
    return rc == Z_STREAM_END ? std::optional<std::string>(out) : std::nullopt;
}

struct X509Deleter {
    void operator()(X509* x) const { X509_free(x); }
};
using X509Ptr = std::unique_ptr<X509, X509Deleter>;

X509Ptr certificateFromBase64(const std::string& text) {
    auto der = base64Decode(text);
    if (!der) {
        return nullptr;
    }
    const unsigned char* p = der->data();
    return X509Ptr(d2i_X509(nullptr, &p, static_cast<long>(der->size())));
}

// The decoded "X-Velmora-Kva" header: the chain, leaf first.
std::vector<X509Ptr> chainFromHeader(const HttpRequest& request) {
    std::vector<X509Ptr> chain;
    auto header = request.valueForHeader("X-Velmora-Kva");
    auto compressed = header ? base64Decode(*header) : std::nullopt;
    auto json = compressed ? inflateRaw(*compressed) : std::nullopt;
    auto value = json ? parseJson(*json) : std::nullopt;
    const Value* certs = value ? value->find("certs") : nullptr;
    if (!certs || !certs->asArray() || value->size() != 1) {
        return chain;
    }
    for (const auto& c : *certs->asArray()) {
        chain.push_back(c.asString() ? certificateFromBase64(*c.asString()) : nullptr);
    }
    return chain;
}

bool signatureVerifies(X509* leaf, const std::string& signatureBase64, std::string_view body) {
    auto signature = base64Decode(signatureBase64);
    EVP_PKEY* key = X509_get0_pubkey(leaf);
    if (!signature || !key) {
        return false;
    }
    std::unique_ptr<EVP_MD_CTX, decltype(&EVP_MD_CTX_free)> ctx(EVP_MD_CTX_new(), EVP_MD_CTX_free);
    return EVP_DigestVerifyInit(ctx.get(), nullptr, EVP_sha256(), nullptr, key) == 1 &&
           EVP_DigestVerify(ctx.get(), signature->data(), signature->size(),
                            reinterpret_cast<const unsigned char*>(body.data()), body.size()) == 1;
}

X509Ptr readRoot(const std::string& pem) {
    std::unique_ptr<BIO, decltype(&BIO_free)> bio(
        BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())), BIO_free);
    return X509Ptr(PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr));
}

// Verified at the pinned time of the test clock, which dates the leaves.
bool chainVerifies(X509* leaf, X509* intermediate, X509* root, std::time_t at = 1'700'000'000) {
    std::unique_ptr<X509_STORE, decltype(&X509_STORE_free)> store(X509_STORE_new(),
                                                                  X509_STORE_free);
    std::unique_ptr<STACK_OF(X509), void (*)(STACK_OF(X509)*)> untrusted(
        sk_X509_new_null(), [](STACK_OF(X509) * s) { sk_X509_free(s); });
    std::unique_ptr<X509_STORE_CTX, decltype(&X509_STORE_CTX_free)> ctx(X509_STORE_CTX_new(),
                                                                        X509_STORE_CTX_free);
    X509_STORE_add_cert(store.get(), root);
    if (intermediate) {
        sk_X509_push(untrusted.get(), intermediate);
    }
    X509_STORE_CTX_init(ctx.get(), store.get(), leaf, untrusted.get());
    X509_STORE_CTX_set_time(ctx.get(), 0, at);
    return X509_verify_cert(ctx.get()) == 1;
}

std::string extensionText(X509* certificate, const std::string& oid) {
    std::unique_ptr<ASN1_OBJECT, decltype(&ASN1_OBJECT_free)> object(OBJ_txt2obj(oid.c_str(), 1),
                                                                     ASN1_OBJECT_free);
    int index = X509_get_ext_by_OBJ(certificate, object.get(), -1);
    if (index < 0) {
        return {};
    }
    ASN1_OCTET_STRING* data = X509_EXTENSION_get_data(X509_get_ext(certificate, index));
    const unsigned char* p = ASN1_STRING_get0_data(data);
    std::unique_ptr<ASN1_UTF8STRING, decltype(&ASN1_UTF8STRING_free)> text(
        d2i_ASN1_UTF8STRING(nullptr, &p, ASN1_STRING_length(data)), ASN1_UTF8STRING_free);
    return text ? std::string(reinterpret_cast<const char*>(ASN1_STRING_get0_data(text.get())),
                              static_cast<std::size_t>(ASN1_STRING_length(text.get())))
                : std::string();
}

class QAXKVAManagerTest : public ::testing::Test {
  protected:
    QAXKVAManagerTest() {
        host = std::make_shared<HostAttestationService>(tp.platform->platformRoot,
                                                        tp.platform->deviceProperties, tp.clock);
        scripted = std::make_shared<test::ScriptedAttestationService>(host);
        tp.platform->attestation = scripted;
    }

    test::TestPlatform tp;
    std::shared_ptr<HostAttestationService> host;
    std::shared_ptr<test::ScriptedAttestationService> scripted;
    HttpRequest request{"https://coverage.example/api/v3/coverage/summary", 30};
};

TEST_F(QAXKVAManagerTest, HeadersCarryAVerifiableSignatureAndChain) {
    addKVAAuthenticationHeadersWithBody(request, *tp.platform, kBody);
    scripted->drain();
    ASSERT_TRUE(request.valueForHeader("X-Velmora-Kva-S"));
    // What the attestation service was asked for.
    ASSERT_EQ(scripted->calls().size(), 1u);
    const AttestationOptions o = scripted->calls()[0];
    EXPECT_EQ(o.keyStoreLabel, "com.velmora.qaxagent.kvaCertificates");
    EXPECT_EQ(o.keyStoreAccessGroup, "com.velmora.qaxagent");
    EXPECT_TRUE(o.includeCACertificate);
    EXPECT_EQ(o.networkTimeoutInterval, 60);
    EXPECT_FALSE(o.svxtAttestation);
    EXPECT_EQ(o.validity, 43200);
    ASSERT_TRUE(o.accessControls);
    EXPECT_EQ(o.accessControls->accessibility, KeyAccessibility::AfterFirstUnlockThisDeviceOnly);
    EXPECT_TRUE(o.accessControls->privateKeyUsageOnly);
    EXPECT_EQ(o.oidsToInclude,
              (std::vector<AttestationOID>{
                  AttestationOID::UVXTDeviceIdentifiers, AttestationOID::DeviceIdentifiers,
                  AttestationOID::HardwareProperties, AttestationOID::AccessControls,
                  AttestationOID::DeviceOSInformation}));
    auto chain = chainFromHeader(request);
    ASSERT_EQ(chain.size(), 2u);
    ASSERT_TRUE(chain[0] && chain[1]);

    EXPECT_TRUE(
        signatureVerifies(chain[0].get(), *request.valueForHeader("X-Velmora-Kva-S"), kBody));
    EXPECT_FALSE(signatureVerifies(chain[0].get(), *request.valueForHeader("X-Velmora-Kva-S"),
                                   std::string(kBody) + " "));
    auto rootPEM = host->rootCertificatePEM(nullptr);
    ASSERT_TRUE(rootPEM);
    auto root = readRoot(*rootPEM);
    ASSERT_TRUE(root);
    EXPECT_TRUE(chainVerifies(chain[0].get(), chain[1].get(), root.get()));
    // The intermediate is needed, and another device's root does not vouch for this leaf.
    EXPECT_FALSE(chainVerifies(chain[0].get(), nullptr, root.get()));
    test::TempDir otherRoot;
    HostAttestationService other(otherRoot.str(), tp.platform->deviceProperties, tp.clock);
    auto otherPEM = other.rootCertificatePEM(nullptr);
    ASSERT_TRUE(otherPEM);
    EXPECT_FALSE(chainVerifies(chain[0].get(), chain[1].get(), readRoot(*otherPEM).get()));

    // The leaf vouches for the device's facts.
    auto ids = parseJson(extensionText(
        chain[0].get(), HostAttestationService::extensionOID(AttestationOID::DeviceIdentifiers)));
    ASSERT_TRUE(ids);
    EXPECT_EQ(*ids->find("SerialNumber"), Value("C02TESTSERIAL"));

    // Validity: 43200 minutes from the pinned clock.
    int days = 0, seconds = 0;
    ASSERT_EQ(ASN1_TIME_diff(&days, &seconds, X509_get0_notBefore(chain[0].get()),
                             X509_get0_notAfter(chain[0].get())),
              1);
    EXPECT_EQ(days * 86400 + seconds, 43200 * 60 + 300);

    struct stat st {};
    auto keyPath = std::filesystem::path(tp.platform->platformRoot) / "state" / "keys" /
                   "com.velmora.qaxagent.kvaCertificates.pem";
    ASSERT_EQ(::stat(keyPath.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);

    // One key per label: a second request is signed with the same key.
    HttpRequest again("https://coverage.example/");
    addKVAAuthenticationHeadersWithBody(again, *tp.platform, "other body");
    scripted->drain();
    auto chain2 = chainFromHeader(again);
    ASSERT_EQ(chain2.size(), 2u);
    EXPECT_EQ(EVP_PKEY_eq(X509_get0_pubkey(chain[0].get()), X509_get0_pubkey(chain2[0].get())), 1);
    EXPECT_TRUE(
        signatureVerifies(chain[0].get(), *again.valueForHeader("X-Velmora-Kva-S"), "other body"));
}

TEST_F(QAXKVAManagerTest, IssuanceOutcomes) {
    const std::string fallback =
        "-[QAXKVAManager generateKVACertficate:]_completion: KVA (UVXT) failed due to missing "
        "UVXT with error: AttestationError(code -11): scripted failure, falling back to KVA (SVXT)";
    const std::string noChain =
        "-[QAXKVAManager generateKVACertficate:]_completion: Failed to get reference key or cert!";
    // clang-format off
    // The script, whether a key came, the issuances, what the completion got, messages logged.
    const std::tuple<const char*, std::vector<Step>, bool, std::size_t, bool, std::optional<long>, std::vector<std::string>> rows[] = {
        {"missing user certificate (-11) falls back", {{Step::Fail, -11}, {Step::Forward}}, true,
         2, true, std::nullopt, {fallback}},
        {"missing user certificate (-4) falls back", {{Step::Fail, -4}, {Step::Forward}}, true, 2,
         true, std::nullopt, {}},
        {"a failing fallback is not retried", {{Step::Fail, -11}, {Step::Fail, -11}}, false, 2,
         false, -11, {}},
        {"a fallback's key and chain count despite an error",
         {{Step::Fail, -4}, {Step::ForwardWithError, -9}}, true, 2, true, -9, {}},
        {"another error ends issuance", {{Step::Fail, -2}}, false, 1, false, -2, {}},
        {"no chain", {{Step::KeyOnly}}, false, 1, false, std::nullopt, {noChain}},
    };
    // clang-format on
    for (const auto& [name, script, generates, issuances, completionHasChain, completionError,
                      messages] : rows) {
        SCOPED_TRACE(name);
        tp.log->clear();
        scripted->script.assign(script.begin(), script.end());
        std::size_t before = scripted->calls().size();
        std::atomic<int> completions{0};
        bool hadChain = false;
        std::optional<long> error;
        auto manager = QAXKVAManager::create(scripted);
        bool generated = manager->generateKVACertficate([&](std::optional<CertificateChain> chain,
                                                            std::shared_ptr<AttestationKey>,
                                                            std::optional<AttestationError> e) {
            ++completions;
            hadChain = chain && !chain->empty();
            error = e ? std::optional<long>(e->code) : std::nullopt;
        });
        scripted->drain();
        EXPECT_EQ(generated, generates);
        EXPECT_EQ(completions.load(), 1) << "one completion, one signal";
        EXPECT_EQ(hadChain, completionHasChain);
        EXPECT_EQ(error, completionError);
        auto calls = scripted->calls();
        ASSERT_EQ(calls.size() - before, issuances);
        EXPECT_FALSE(calls[before].svxtAttestation);
        if (issuances == 2) {
            EXPECT_TRUE(calls[before + 1].svxtAttestation);
        }
        for (const auto& m : messages) {
            EXPECT_TRUE(tp.log->contains(m)) << m;
        }
        EXPECT_EQ(generated, manager->privateKey() != nullptr);
    }
}

TEST_F(QAXKVAManagerTest, FailuresLeaveTheHeadersOut) {
    struct Row {
        const char* name;
        void (*setUp)(test::ScriptedAttestationService&);
        bool signatureHeader;
        bool chainHeader;
        std::vector<std::string> messages;
        std::size_t issuances;
    };
    using S = test::ScriptedAttestationService;
    // clang-format off
    const Row rows[] = {
        {"unsupported device", [](S& s) { s.supported = false; }, false, false,
         {"-[QAXKVAManager generateKVACertficate:]: veridonSupported on this device:0",
          "KVA certificate generation success: 0"}, 0},
        {"access control refused", [](S& s) { s.accessControlFails = true; }, false, false,
         {"Failed to create access control: access control refused"}, 0},
        {"issuance error", [](S& s) { s.script = {{Step::Fail, -2}}; }, false, false,
         {"Device authentication failed while generating certificate with error: "
          "AttestationError(code -2): scripted failure"}, 1},
        {"chain too small to compress", [](S& s) { s.script = {{Step::EmptyChain}}; }, true, false,
         {"Unable to sign request",
          "-[QAXKVAManager addKVAAuthenticationHeadersToRequest:withBody:error:]: Failed to add "
          "Kva Headers with error: (null)"}, 1},
        {"certificate without bytes is skipped", [](S& s) { s.script = {{Step::NullLeaf}}; }, true,
         true, {"-[QAXKVAManager serializeCertificateChain:]: Found NULL attestation data!!",
                "Device authentication successful"}, 1},
    };
    // clang-format on
    for (const auto& row : rows) {
        SCOPED_TRACE(row.name);
        test::TestPlatform local;
        auto service = std::make_shared<test::ScriptedAttestationService>(host);
        row.setUp(*service);
        local.platform->attestation = service;
        HttpRequest r("https://coverage.example/");
        addKVAAuthenticationHeadersWithBody(r, *local.platform, kBody);
        service->drain();
        EXPECT_EQ(r.valueForHeader("X-Velmora-Kva-S").has_value(), row.signatureHeader);
        EXPECT_EQ(r.valueForHeader("X-Velmora-Kva").has_value(), row.chainHeader);
        for (const auto& m : row.messages) {
            EXPECT_TRUE(local.log->contains(m)) << m;
        }
        EXPECT_EQ(service->calls().size(), row.issuances);
    }
}

TEST_F(QAXKVAManagerTest, TimeoutCoversBothAttemptsAndALateAnswerStillStores) {
    scripted->script = {{Step::Fail, -11}, {Step::Never}};
    double askedFor = 0;
    // Stands in for the 60-second wait: checks what was asked and gives up quickly.
    auto shortWait = [&](QAXKVAManager::Signal& signal, double seconds) {
        askedFor = seconds;
        return signal.try_acquire_for(std::chrono::milliseconds(50));
    };
    auto manager = QAXKVAManager::create(scripted, shortWait);
    std::atomic<int> completions{0};
    EXPECT_FALSE(manager->generateKVACertficate([&](auto, auto, auto) { ++completions; }));
    EXPECT_EQ(askedFor, 60);
    EXPECT_TRUE(tp.log->contains(
        "-[QAXKVAManager generateKVACertficate:]: Installation timed out after 60 seconds"));
    EXPECT_EQ(completions.load(), 0);
    EXPECT_EQ(scripted->calls().size(), 2u);

    // The late answer still reaches the manager (kept alive by its completion).
    scripted->releaseHeldCompletion();
    for (int i = 0; i < 500 && completions.load() == 0; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    EXPECT_EQ(completions.load(), 1);
    EXPECT_TRUE(manager->privateKey());
    EXPECT_TRUE(manager->clientCertArray());
}

TEST_F(QAXKVAManagerTest, RawDeflateIntoABufferNoLargerThanItsInput) {
    std::string compressible(4000, 'a');
    for (std::size_t i = 0; i < compressible.size(); i += 7) {
        compressible[i] = static_cast<char>('a' + i % 13);
    }
    auto packed = QAXKVAManager::_zlibCompressionForData(compressible);
    ASSERT_TRUE(packed);
    EXPECT_LT(packed->size(), compressible.size());
    EXPECT_EQ(inflateRaw(*packed), compressible);
    // Again on the same thread, to be sure a reused stream starts clean.
    EXPECT_EQ(QAXKVAManager::_zlibCompressionForData(compressible), packed);

    std::string random(64, '\0');
    std::uint32_t x = 2463534242u;
    for (auto& c : random) {
        x ^= x << 13, x ^= x >> 17, x ^= x << 5;
        c = static_cast<char>(x);
    }
    EXPECT_FALSE(QAXKVAManager::_zlibCompressionForData(random)) << "does not fit";
    EXPECT_FALSE(QAXKVAManager::_zlibCompressionForData(""));
}

TEST_F(QAXKVAManagerTest, SerialNumberBodyIsSignedButNotSet) {
    addKVAAuthenticationHeadersWithSerialNumber(request, *tp.platform, "C02X");
    scripted->drain();
    EXPECT_FALSE(request.body());
    auto chain = chainFromHeader(request);
    ASSERT_EQ(chain.size(), 2u);
    EXPECT_TRUE(signatureVerifies(chain[0].get(), *request.valueForHeader("X-Velmora-Kva-S"),
                                  R"({"serialNumber":"C02X"})"));
}

TEST(HostAttestationServiceTest, PlatformFileControlsSupportAndFirstIssuance) {
    test::TestPlatform tp;
    auto service = std::make_shared<HostAttestationService>(
        tp.platform->platformRoot, tp.platform->deviceProperties, tp.clock);
    tp.platform->attestation = service;
    const auto file = std::filesystem::path(tp.platform->platformRoot) / "attestation.plist";
    EXPECT_TRUE(service->isAttestationSupported()) << "no file: supported";

    test::writeFile(file, *toXmlPlist(Value::Dictionary{{"Supported", false}}));
    EXPECT_FALSE(service->isAttestationSupported());
    HttpRequest none("https://coverage.example/");
    addKVAAuthenticationHeadersWithBody(none, *tp.platform, kBody);
    EXPECT_FALSE(none.valueForHeader("X-Velmora-Kva"));

    test::writeFile(file, *toXmlPlist(Value::Dictionary{{"FirstIssuanceErrorCode", -11}}));
    HttpRequest fallback("https://coverage.example/");
    addKVAAuthenticationHeadersWithBody(fallback, *tp.platform, kBody);
    EXPECT_TRUE(fallback.valueForHeader("X-Velmora-Kva"));
    EXPECT_TRUE(tp.log->countContaining("falling back to KVA (SVXT)") == 1);
    auto chain = chainFromHeader(fallback);
    ASSERT_EQ(chain.size(), 2u);
    auto level = parseJson(
        extensionText(chain[0].get(),
                      HostAttestationService::extensionOID(AttestationOID::UVXTDeviceIdentifiers)));
    ASSERT_TRUE(level);
    EXPECT_EQ(*level->find("level"), Value("SVXT"));

    test::writeFile(file, *toXmlPlist(Value::Dictionary{{"FirstIssuanceErrorCode", -2}}));
    HttpRequest failed("https://coverage.example/");
    addKVAAuthenticationHeadersWithBody(failed, *tp.platform, kBody);
    EXPECT_FALSE(failed.valueForHeader("X-Velmora-Kva"));

    // The CA survives a new service on the same platform root.
    auto first = service->rootCertificatePEM(nullptr);
    HostAttestationService again(tp.platform->platformRoot, tp.platform->deviceProperties,
                                 tp.clock);
    EXPECT_EQ(again.rootCertificatePEM(nullptr), first);
}

TEST(HostAttestationServiceTest, LastReferenceDroppedOnItsOwnThread) {
    test::TestPlatform tp;
    auto service = std::make_shared<HostAttestationService>(
        tp.platform->platformRoot, tp.platform->deviceProperties, tp.clock);
    AttestationOptions options;
    options.keyStoreLabel = "label";
    options.validity = 1;
    auto released = std::make_shared<std::promise<void>>();
    auto done = std::make_shared<std::promise<bool>>();
    // The completion waits until the test has let go, so that its copy is the last one.
    service->issueClientCertificate(
        options, [keep = service, released = released->get_future().share(), done](auto key, auto,
                                                                                   auto) mutable {
            released.wait();
            keep.reset();  // the service goes on its own thread
            done->set_value(key != nullptr);
        });
    service.reset();
    released->set_value();
    auto future = done->get_future();
    ASSERT_EQ(future.wait_for(std::chrono::seconds(20)), std::future_status::ready);
    EXPECT_TRUE(future.get());
}

}  // namespace
}  // namespace qax
