// The native methods of com.orvane.quill.flowgauge.core.ft.client.FileTransferClient.
// Strings pass as the JNI's modified UTF-8; statuses as Java ints. No Java
// exception leaves these functions: a failure shows as a status, a null
// result or an empty array.
#include <jni.h>

#include "dpx/dpx.h"

#include "afw/afw.h"
#include "trc/trc1.h"

#include <cstring>

TRC1_DEFINE_UNIT("dpxjni");

namespace {

constexpr int16_t kNodeListMax = 127;  // 128 entries

// Clears a pending Java exception; true if there was one.
bool checkException(JNIEnv *env)
{
    if (env->ExceptionCheck()) {
        env->ExceptionClear();
        return true;
    }
    return false;
}

// The characters of a Java string; null for a null string, or when the JVM
// can't give them (its exception then stays pending for the caller).
const char *take_chars(JNIEnv *env, jstring text)
{
    return text != nullptr ? env->GetStringUTFChars(text, nullptr) : nullptr;
}

void release_chars(JNIEnv *env, jstring text, const char *chars)
{
    if (chars != nullptr)
        env->ReleaseStringUTFChars(text, chars);
}

// A Java string of a library text; null for a null text or when the JVM
// can't make one.
jstring new_string(const trc::Scope &scope, JNIEnv *env, const char *text)
{
    if (text == nullptr)
        return nullptr;
    jstring result = env->NewStringUTF(text);
    if (checkException(env) && scope.on(TRC1_ERROR))
        TRC1_Printf(scope.desc(), __LINE__, "NewStringUTF failed.");
    return result;
}

}  // namespace

extern "C" {

JNIEXPORT jint JNICALL Java_com_orvane_quill_flowgauge_core_ft_client_FileTransferClient_getFile(
    JNIEnv *env, jobject, jstring node, jstring path, jstring target)
{
    TRC1_FUNCTION();
    const char *n = take_chars(env, node);
    const char *p = take_chars(env, path);
    const char *t = take_chars(env, target);
    dpx_status status = GetFile(n, p, t);
    release_chars(env, node, n);
    release_chars(env, path, p);
    release_chars(env, target, t);
    return static_cast<jint>(status);
}

JNIEXPORT jint JNICALL Java_com_orvane_quill_flowgauge_core_ft_client_FileTransferClient_putFile(
    JNIEnv *env, jobject, jstring node, jstring path, jstring source)
{
    TRC1_FUNCTION();
    const char *n = take_chars(env, node);
    const char *p = take_chars(env, path);
    const char *s = take_chars(env, source);
    dpx_status status = PutFile(n, p, s);
    release_chars(env, node, n);
    release_chars(env, path, p);
    release_chars(env, source, s);
    return static_cast<jint>(status);
}

JNIEXPORT jint JNICALL Java_com_orvane_quill_flowgauge_core_ft_client_FileTransferClient_query(
    JNIEnv *env, jobject, jstring node, jstring query, jstring path)
{
    TRC1_FUNCTION();
    const char *n = take_chars(env, node);
    const char *q = take_chars(env, query);
    const char *p = take_chars(env, path);
    uint32_t result = 0;
    dpx_status status = Query(n, q, p, &result);
    release_chars(env, node, n);
    release_chars(env, query, q);
    release_chars(env, path, p);
    return static_cast<jint>(status);
}

JNIEXPORT jobjectArray JNICALL Java_com_orvane_quill_flowgauge_core_ft_client_FileTransferClient_listNodes(
    JNIEnv *env, jobject, jstring filter)
{
    TRC1_FUNCTION();
    const char *f = take_chars(env, filter);
    int16_t last = -1;
    dpx_node_name nodes[kNodeListMax + 1];
    jobjectArray array = nullptr;

    jclass string_class = env->FindClass("java/lang/String");
    if (checkException(env))
        TRC1_ERROR_MSG("FindClass failed.");
    jstring empty = env->NewStringUTF("");
    if (checkException(env))
        TRC1_ERROR_MSG("NewStringUTF failed.");

    // Without the class or the initial element there is no array to give:
    // the hub isn't asked.
    if (string_class != nullptr && empty != nullptr) {
        if (ListNodes(f, &last, kNodeListMax, nodes) == DPX_OK && last >= 0) {
            array = env->NewObjectArray(last + 1, string_class, empty);
            if (checkException(env))
                TRC1_ERROR_MSG("NewObjectArray failed.");
        }
        // Element references are dropped one by one: a list of 128 names
        // stays within the local references the JVM guarantees a native.
        for (int16_t i = 0; array != nullptr && i <= last; ++i) {
            // An entry keeps its terminator: at most 32 characters reach Java.
            char name[DPX_NODE_LEN];
            std::memcpy(name, nodes[i], sizeof name);
            name[DPX_NODE_LEN - 1] = '\0';
            jstring element = env->NewStringUTF(name);
            if (checkException(env))
                TRC1_ERROR_MSG("NewStringUTF failed.");
            if (element != nullptr) {
                env->SetObjectArrayElement(array, i, element);
                if (checkException(env))
                    TRC1_ERROR_MSG("SetObjectArrayElement failed.");
                env->DeleteLocalRef(element);
            }
        }
        if (array == nullptr) {
            array = env->NewObjectArray(0, string_class, empty);
            if (checkException(env))
                TRC1_ERROR_MSG("NewObjectArray failed.");
        }
    }
    if (string_class != nullptr)
        env->DeleteLocalRef(string_class);
    if (empty != nullptr)
        env->DeleteLocalRef(empty);
    release_chars(env, filter, f);
    return array;
}

JNIEXPORT jstring JNICALL Java_com_orvane_quill_flowgauge_core_ft_client_FileTransferClient_getRootDepot(
    JNIEnv *env, jobject)
{
    TRC1_FUNCTION();
    return new_string(trc1_scope_, env, GetRootDepot());
}

JNIEXPORT jstring JNICALL Java_com_orvane_quill_flowgauge_core_ft_client_FileTransferClient_getAgentID(
    JNIEnv *env, jobject)
{
    TRC1_FUNCTION();
    return new_string(trc1_scope_, env, GetProduct());
}

JNIEXPORT jstring JNICALL Java_com_orvane_quill_flowgauge_core_ft_client_FileTransferClient_getOriginNode(
    JNIEnv *env, jobject)
{
    TRC1_FUNCTION();
    return new_string(trc1_scope_, env, AFW_GetOriginnode());
}

JNIEXPORT jstring JNICALL Java_com_orvane_quill_flowgauge_core_ft_client_FileTransferClient_getRPCErrText(
    JNIEnv *env, jobject, jint status)
{
    TRC1_FUNCTION();
    char text[256];
    const char *message = error__c_text(static_cast<uint32_t>(status), text, sizeof text);
    if (message == nullptr || message[0] == '\0')
        return nullptr;
    return new_string(trc1_scope_, env, message);
}

}  // extern "C"
