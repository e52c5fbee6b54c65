#include "security/X509Name.hpp"

#include "security/SSLCheck.hpp"

#include <memory>
#include <openssl/objects.h>
#include <string>

namespace qel {

namespace {

struct FreeByOpenSSL {
    void operator()(unsigned char* text) const noexcept { OPENSSL_free(text); }
};

std::string fieldName(const ASN1_OBJECT* object)
{
    const int nid = OBJ_obj2nid(object);
    const char* const shortName = nid != NID_undef ? OBJ_nid2sn(nid) : nullptr;
    if (shortName != nullptr) return shortName;            // a field that a program has registered may have none
    const int length = OBJ_obj2txt(nullptr, 0, object, 1); // without the NUL that the second call adds
    checkSSL(length > 0);
    std::string numbers(static_cast<std::size_t>(length) + 1, '\0');
    checkSSL(OBJ_obj2txt(numbers.data(), length + 1, object, 1) == length);
    numbers.pop_back();
    return numbers;
}

std::string utf8Of(const ASN1_STRING* value)
{
    unsigned char* text = nullptr;
    const int length = ASN1_STRING_to_UTF8(&text, value);
    const std::unique_ptr<unsigned char, FreeByOpenSSL> owner(text);
    checkSSL(length >= 0);
    return std::string(text, text + length);
}

} // namespace

void addFields(X509_NAME* name, const SSLSubject& fields)
{
    constexpr int kNulTerminated = -1;
    constexpr int kAppend = -1;
    constexpr int kNewSet = 0;
    for (const auto& [field, value] : fields) {
        const auto* const text = reinterpret_cast<const unsigned char*>(value.c_str());
        checkSSL(
            X509_NAME_add_entry_by_txt(name, field.c_str(), MBSTRING_ASC, text, kNulTerminated, kAppend, kNewSet) == 1);
    }
}

SSLSubject readFields(const X509_NAME* name)
{
    SSLSubject fields;
    const int count = X509_NAME_entry_count(name);
    for (int i = 0; i < count; ++i) {
        const X509_NAME_ENTRY* const entry = X509_NAME_get_entry(name, i);
        const std::string value = utf8Of(X509_NAME_ENTRY_get_data(entry));
        const auto [field, isNew] = fields.emplace(fieldName(X509_NAME_ENTRY_get_object(entry)), value);
        if (!isNew) field->second += '\n' + value;
    }
    return fields;
}

} // namespace qel
