// The constants that clients and the daemon share: keys of the dictionaries that cross the IPC interface, names of
// back ends, the error domain. They are part of the wire contract.
#pragma once

namespace kyt {

// Session information.
inline constexpr char kKYTReportingSessionInfoSessionID[] = "SessionID";
inline constexpr char kKYTReportingSessionInfoClientType[] = "ClientType";
inline constexpr char kKYTReportingSessionInfoClientVersion[] = "ClientVersion";
inline constexpr char kKYTReportingSessionInfoBatchEvent[] = "BatchEvent";
inline constexpr char kKYTReportingSessionInfoRequireUserInfo[] = "RequireUserInfo";
inline constexpr char kKYTReportingSessionInfoHierarchyToken[] = "HierarchyToken";
inline constexpr char kKYTReportingHierarchyTokenLevel[] = "Level";
inline constexpr char kKYTReportingHierarchyTokenTokenID[] = "TokenID";

// User information.
inline constexpr char kKYTReportingUserInfoClientName[] = "ClientName";
inline constexpr char kKYTReportingUserInfoServiceName[] = "ServiceName";

// Message parameters.
inline constexpr char kKYTReportingMessageParametersCategory[] = "Category";
inline constexpr char kKYTReportingMessageParametersType[] = "Type";
inline constexpr char kKYTReportingMessageParametersPayload[] = "Payload";
inline constexpr char kKYTReportingMessageParametersFlag[] = "Flag";

inline constexpr char kKYTReportingErrorDomain[] = "KYTReportingErrorDomain";

// Back ends: keys of the storebag's section and of a session's back-end dictionary.
inline constexpr char kKYTReportingBackendHTTPPost[] = "httppost";
inline constexpr char kKYTReportingBackendHTTPPost2[] = "httppost2";
inline constexpr char kKYTReportingBackendQRS[] = "qrs";
inline constexpr char kKYTReportingBackendDashboard[] = "dashboard";
inline constexpr char kKYTReportingBackendUploadServer[] = "uploadserver";
inline constexpr char kKYTReportingBackendQDX[] = "qdx";
inline constexpr char kKYTReportingBackendAmpyx[] = "ampyx";

// The two entries of the envelope that back ends receive.
inline constexpr char kKYTReportingMessageBlobSharedData[] = "SharedData";
inline constexpr char kKYTReportingMessageBlobClientData[] = "ClientData";

// The named service, the entitlement, and the identity to which the system attributes the traffic.
inline constexpr char kServiceName[] = "com.vantu.kytreportingd";
inline constexpr char kEntitlement[] = "com.vantu.private.kytreportingd";
inline constexpr char kSourceApplication[] = "com.vantu.system.diagnostics";

}  // namespace kyt
