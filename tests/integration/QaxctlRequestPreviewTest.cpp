// qaxctl request-preview and attestation-ca run as real processes on a temporary HOME and
// platform root: the printed request is the one a download attempt would send, and its
// attestation verifies against the root that attestation-ca prints.
#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <openssl/x509_vfy.h>
#include <sys/wait.h>
#include <zlib.h>

#include <array>
#include <cstdio>
#include <string>

#include "core/Base64.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "fakes/TestPlatform.h"

namespace qax {
namespace {

namespace fs = std::filesystem;

struct Result {
    int status = -1;
    std::string out;
    std::string err;
};

class RequestPreviewTest : public ::testing::Test {
  protected:
    RequestPreviewTest() {
        root = dir.path() / "root";
        fs::create_directories(dir.path() / "home");
        test::writeFile(root / "device.plist",
                        *toXmlPlist(Value(Value::Dictionary{{"SerialNumber", "C02DEVICE"},
                                                            {"ProductType", "Model9,1"},
                                                            {"ProductVersion", "4.2"}})));
    }

    void writeAccounts() {
        Value::Dictionary tokens{{"com.velmora.kf.supportapp.auth", "stored-token"}};
        test::writeFile(
            root / "accounts.plist",
            *toXmlPlist(Value(Value::Dictionary{
                {"PrimaryCloudAccount", Value(Value::Dictionary{{"altDSID", "primary"}})},
                {"KFAccount",
                 Value(Value::Dictionary{{"altDSID", "kf"}, {"Tokens", Value(tokens)}})},
                {"StoreAccount", Value(Value::Dictionary{{"storefront", "143441-1,29"}})},
            })));
    }

    Result qaxctl(const std::string& args) {
        const fs::path errFile = dir.path() / "stderr.txt";
        std::string cmd = "HOME='" + (dir.path() / "home").string() + "' QAX_PLATFORM_ROOT='" +
                          root.string() + "' '" QAX_CTL_BINARY "' " + args + " 2>'" +
                          errFile.string() + "'";
        Result r;
        FILE* p = popen(cmd.c_str(), "r");
        if (!p) {
            return r;
        }
        std::array<char, 4096> buf{};
        std::size_t n = 0;
        while ((n = fread(buf.data(), 1, buf.size(), p)) > 0) {
            r.out.append(buf.data(), n);
        }
        int status = pclose(p);
        r.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
        r.err = test::readFile(errFile);
        return r;
    }

    test::TempDir dir;
    fs::path root;
};

std::vector<X509*> chainOf(const std::string& header) {
    std::vector<X509*> out;
    auto packed = base64Decode(header);
    if (!packed) {
        return out;
    }
    std::string json(64 * 1024, '\0');
    uLongf length = 0;
    z_stream s{};
    inflateInit2(&s, -MAX_WBITS);
    s.next_in = packed->data();
    s.avail_in = static_cast<uInt>(packed->size());
    s.next_out = reinterpret_cast<Bytef*>(json.data());
    s.avail_out = static_cast<uInt>(json.size());
    inflate(&s, Z_FINISH);
    length = s.total_out;
    inflateEnd(&s);
    json.resize(length);
    auto value = parseJson(json);
    const Value* certs = value ? value->find("certs") : nullptr;
    for (const auto& c : certs && certs->asArray() ? *certs->asArray() : Value::Array{}) {
        auto der = base64Decode(*c.asString());
        const unsigned char* p = der->data();
        out.push_back(d2i_X509(nullptr, &p, static_cast<long>(der->size())));
    }
    return out;
}

TEST_F(RequestPreviewTest, PrintsTheSignedRequestOfADownloadAttempt) {
    auto refused = qaxctl("request-preview C02DEVICE --json");
    EXPECT_EQ(refused.status, 1);
    EXPECT_TRUE(refused.out.empty()) << refused.out;
    EXPECT_NE(refused.err.find("No primary Skyvault account, can't sign this request"),
              std::string::npos)
        << refused.err;

    writeAccounts();
    auto own = qaxctl("request-preview C02DEVICE --bundle-id com.velmora.Preferences --json");
    ASSERT_EQ(own.status, 0) << own.err;
    auto request = parseJson(own.out);
    ASSERT_TRUE(request) << own.out;
    EXPECT_EQ(*request->find("url"),
              Value("https://coverage.velmora.example/api/v3/coverage/summary"));
    EXPECT_EQ(*request->find("method"), Value("POST"));
    const Value& headers = *request->find("headers");
    EXPECT_EQ(*headers.find("X-Velmora-KF-Token"), Value("stored-token"));
    EXPECT_EQ(*headers.find("User-Agent"), Value("<com.velmora.Preferences/4.2/Model9,1>"));
    EXPECT_EQ(*headers.find("storefrontLocale"), Value("143441-1,29"));
    const std::string body = *request->find("body")->asString();
    EXPECT_EQ(*parseJson(body)->find("serialNumber"), Value("C02DEVICE"));

    // The attestation verifies against the root attestation-ca prints.
    auto ca = qaxctl("attestation-ca");
    ASSERT_EQ(ca.status, 0) << ca.err;
    std::unique_ptr<BIO, decltype(&BIO_free)> bio(
        BIO_new_mem_buf(ca.out.data(), static_cast<int>(ca.out.size())), BIO_free);
    X509* rootCertificate = PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr);
    ASSERT_TRUE(rootCertificate);
    auto chain = chainOf(*headers.find("X-Velmora-Kva")->asString());
    ASSERT_EQ(chain.size(), 2u);
    X509_STORE* store = X509_STORE_new();
    X509_STORE_add_cert(store, rootCertificate);
    STACK_OF(X509)* untrusted = sk_X509_new_null();
    sk_X509_push(untrusted, chain[1]);
    X509_STORE_CTX* ctx = X509_STORE_CTX_new();
    X509_STORE_CTX_init(ctx, store, chain[0], untrusted);
    EXPECT_EQ(X509_verify_cert(ctx), 1);
    auto signature = base64Decode(*headers.find("X-Velmora-Kva-S")->asString());
    EVP_MD_CTX* md = EVP_MD_CTX_new();
    EVP_DigestVerifyInit(md, nullptr, EVP_sha256(), nullptr, X509_get0_pubkey(chain[0]));
    EXPECT_EQ(EVP_DigestVerify(md, signature->data(), signature->size(),
                               reinterpret_cast<const unsigned char*>(body.data()), body.size()),
              1);
    EVP_MD_CTX_free(md);
    X509_STORE_CTX_free(ctx);
    sk_X509_free(untrusted);
    X509_STORE_free(store);
    X509_free(rootCertificate);
    for (X509* c : chain) {
        X509_free(c);
    }

    // Another device's request goes to the wearables endpoint without attestation; a later
    // attempt renews the token first.
    auto other = qaxctl("request-preview WATCH-1 --attempt 2 --json");
    ASSERT_EQ(other.status, 0) << other.err;
    auto otherRequest = parseJson(other.out);
    ASSERT_TRUE(otherRequest);
    EXPECT_EQ(*otherRequest->find("url"),
              Value("https://coverage.velmora.example/api/v2/coverage/summary"));
    const Value& otherHeaders = *otherRequest->find("headers");
    EXPECT_FALSE(otherHeaders.find("X-Velmora-Kva"));
    EXPECT_FALSE(otherHeaders.find("X-Velmora-Kva-S"));
    EXPECT_NE(*otherHeaders.find("X-Velmora-KF-Token"), Value("stored-token"));
    EXPECT_EQ(*otherHeaders.find("User-Agent"), Value("<com.velmora.qaxagent/4.2/Model9,1>"));

    EXPECT_EQ(qaxctl("request-preview C02DEVICE --attempt 3").status, 64);
}

}  // namespace
}  // namespace qax
