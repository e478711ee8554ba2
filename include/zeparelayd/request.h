// One HTTP(S) GET or POST over a libcurl easy handle, sharing cookies and the
// DNS cache with every other request of the process. Single-threaded.
#ifndef ZEPARELAYD_REQUEST_H
#define ZEPARELAYD_REQUEST_H

#include <curl/curl.h>
#include <json/value.h>

#include <list>
#include <string>

#include <zeparelayd/errors.h>
#include <zeparelayd/export.h>

namespace ZEPA {
namespace Relay {

class ZEPARELAYD_API Request {
public:
    // The URL usually comes from ServerConf::GetUrl(nullptr): the server's own
    // page ("Serv.php" unless configured); an invalid server gives an empty URL
    // and so an invalid request (IsValid false, Send fails). A null url leaves
    // the request invalid too; a null data means an empty body. data is copied.
    Request(const char* url, const char* data, bool post);
    Request(const std::string& url, const Json::Value& data, bool post);
    // Each request owns its libcurl easy handle, freed by the destructor. A
    // copy gets a duplicate handle with the same URL and body, ready to be
    // sent again; the answer, the result and the received cookies are not
    // copied.
    Request(const Request& other);
    // Does not free the handle held before: only assign to a request without one.
    Request& operator=(const Request& other);
    // A request added to a multi handle must be removed (JobRemove) first.
    ~Request();

    // Find the request that owns a finished easy handle of a multi loop.
    bool operator==(const void* handle) const;
    bool operator!=(const void* handle) const;

    bool IsValid() const;
    const std::string& GetUrl() const;
    const std::string& GetData() const;
    bool GetData(Json::Value& out) const;
    CURLcode GetCurlResult() const;

    // Payload and set-up.
    bool Set(const std::string& url, const std::string& data, bool post);
    bool Set(const std::string& url, const Json::Value& data, bool post);
    bool SetData(const std::string& data, bool post);
    bool SetData(const Json::Value& data, bool post);

    // Transfer.
    bool InitSend();
    bool Send();
    bool JobAdd(void* multi);
    bool JobDone(CURLcode code);
    bool JobRemove(void* multi);
    int GetHttpStatus();
    std::string GetResponse() const;
    bool GetResponse(Json::Value& out) const;
    RELAYD_RET GetError() const;
    bool SetTcpKeepAlive(int seconds);
    bool Write(Json::Value& out) const;
    // The easy handle (null when invalid), for callers that tune or inspect
    // a transfer themselves; it stays the request's: never clean it up.
    CURL* GetCurlHandle() const;

    // Process-wide cookie and DNS state.
    static CURLSH* GetCurlShare(bool renew);
    static bool CleanDnsCache();
    static std::string& GetCookie();
    static bool SetCookie(const std::string& cookie);
    // A CA file trusted in addition to the system's for "https://" requests.
    // Empty (the default) adds nothing; only staging set-ups and tests set it.
    static void SetExtraCaFile(const std::string& path);
    static const std::string& GetExtraCaFile();
    bool GetCookies(std::list<std::string>& out) const;
    bool SaveCookies();

    static std::string _strCookie;
    static CURLSH* _share;
    // Set whenever the share handle is discarded; read by the daemon program.
    static bool blForbidConnReuse;

private:
    std::list<std::string> _cookies;
    std::string _url;
    std::string _data;
    std::string _response;
    CURL* _curl;
    CURLcode _curlResult;
    char _errorBuffer[CURL_ERROR_SIZE];
    bool _async;
    bool _done;
    long _httpStatus;
    // True once CURLOPT_POSTFIELDS points at _data (until the handle is reset);
    // a copy then re-points its duplicate at its own _data.
    bool _postBody;

    void Reset();
    bool SetUpHandle();
    bool SetUpHttps();
    void FreeHandle();
    bool AdoptHandleOf(const Request& other);
};

}  // namespace Relay
}  // namespace ZEPA

#endif
