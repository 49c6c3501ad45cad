#pragma once

namespace zorvan {

/// The service that the daemon listens on unless its command line names another.
inline constexpr const char* kDefaultServiceName = "com.orbel.zorvan.zrd";

/// The protocol version that this code speaks, and the older one that the daemon still accepts.
inline constexpr int kProtocolVersion = 3;
inline constexpr int kProtocolVersionWithoutForms = 2;

/// Keys of messages.
namespace message {
inline constexpr const char* kRequest = "request";
inline constexpr const char* kVersion = "version";
inline constexpr const char* kPaths = "paths";
inline constexpr const char* kRules = "rules";
inline constexpr const char* kFlags = "flags";
inline constexpr const char* kUuids = "uuids";
inline constexpr const char* kAnnotations = "annotations";
inline constexpr const char* kErrorCode = "errorcode";
inline constexpr const char* kError = "error";
inline constexpr const char* kMatches = "matches";
inline constexpr const char* kExtensions = "extensions";
inline constexpr const char* kConflicts = "conflicts";
}  // namespace message

/// Request types.
namespace request {
inline constexpr const char* kAdd = "add";
inline constexpr const char* kRemove = "remove";
inline constexpr const char* kBulk = "bulk";
inline constexpr const char* kMatch = "match";
inline constexpr const char* kReady = "ready";
inline constexpr const char* kAccess = "access";
inline constexpr const char* kAnnotate = "annotate";
inline constexpr const char* kBulkAnnotate = "bulk-annotate";
inline constexpr const char* kLock = "lock";
}  // namespace request

/// Option bits of "match".
inline constexpr unsigned long ZRDiscoverVersions = 0x1;    // keep every version of an identifier
inline constexpr unsigned long ZRDiscoverDuplicates = 0x4;  // with Versions: equal versions too
inline constexpr unsigned long ZRDiscoverSystemOnly = 0x8;  // only the system volume
inline constexpr unsigned long ZRDiscoverAll = 0x200;  // managers: without visibility and admission

/// What the paths of "lock" name.
inline constexpr unsigned long ZRHoldApplications = 1;
inline constexpr unsigned long ZRHoldPlugIns = 2;

/// Keys of Info.plist dictionaries and of the plug-in dictionary in them.
namespace key {
inline constexpr const char* kExtension = "VXExtension";
inline constexpr const char* kOldStylePlugIn = "Zorvan";
inline constexpr const char* kMultiple = "Multiple";
inline constexpr const char* kAttributes = "VXExtensionAttributes";
inline constexpr const char* kProtocol = "VXExtensionProtocol";
inline constexpr const char* kPrincipalClass = "PrincipalClass";
inline constexpr const char* kEmbeddedCode = "EmbeddedCode";
inline constexpr const char* kEmbeddedProtocol = "EmbeddedProtocol";
inline constexpr const char* kDedicated = "Dedicated";
inline constexpr const char* kPassProxy = "PassProxy";
inline constexpr const char* kExtensionPoint = "VXExtensionPointIdentifier";
inline constexpr const char* kHubProtocolVersion = "HubProtocolVersion";
inline constexpr const char* kShared = "Shared";
inline constexpr const char* kRequestsOpenAccess = "RequestsOpenAccess";
inline constexpr const char* kHostEntitlement = "VXExtensionHostEntitlement";
inline constexpr const char* kCleanTimeout = "CleanTimeout";
inline constexpr const char* kExtensionVersion = "VXExtensionVersion";
inline constexpr const char* kExtensionIdentifier = "VXExtensionIdentifier";
inline constexpr const char* kShortVersion = "QFBundleShortVersionString";
inline constexpr const char* kBundleIdentifier = "QFBundleIdentifier";
inline constexpr const char* kInfoPlistUrl = "QFBundleInfoPlistURL";
/// The protocol of a data-only plug-in, and the default protocol and class of application
/// extensions.
inline constexpr const char* kDataProtocol = "#Data";
inline constexpr const char* kDefaultObject = "VXObject";
}  // namespace key

/// Keys of rules that are not attributes.
namespace rule {
inline constexpr const char* kEntitlementPrefix = "ENTITLEMENT:";
inline constexpr const char* kUuid = "com.orbel.uuid";
inline constexpr const char* kUserElection = "VXUserElection";
inline constexpr const char* kContainingApp = "VXExtensionContainingApp";
}  // namespace rule

/// Keys of a plug-in form.
namespace form {
inline constexpr const char* kHubProtocolVersion = "hubProtocolVersion";
inline constexpr const char* kPath = "path";
inline constexpr const char* kSystemResident = "systemResident";
inline constexpr const char* kIdentifier = "identifier";
inline constexpr const char* kOriginalIdentifier = "original-identifier";
inline constexpr const char* kVersion = "version";
inline constexpr const char* kBundleInfo = "bundleInfo";
inline constexpr const char* kInfo = "info";
inline constexpr const char* kUuid = "uuid";
inline constexpr const char* kLastModified = "lastmodified";
inline constexpr const char* kAnnotations = "annotations";
inline constexpr const char* kEntitlements = "entitlements";
inline constexpr const char* kContainingPath = "containingPath";
inline constexpr const char* kLocalizedContainingName = "localizedContainingDisplayName";
inline constexpr const char* kLocalizedName = "localizedDisplayName";
inline constexpr const char* kLocalizedShortName = "localizedShortName";
inline constexpr const char* kHash = "hash";
inline constexpr const char* kRequirement = "requirement";
inline constexpr const char* kOverrider = "overrider";
inline constexpr const char* kOverriding = "overriding";
inline constexpr const char* kExtensions = "extensions";
}  // namespace form

/// Keys of the activation overlay that tells the launcher how to start a plug-in, and of the
/// service dictionary in it.
namespace overlay {
inline constexpr const char* kService = "LUMService";
inline constexpr const char* kPackageType = "QFBundlePackageType";
inline constexpr const char* kLumPackage = "LUM!";
inline constexpr const char* kEnvironment = "EnvironmentVariables";
inline constexpr const char* kProfile = "_SandboxProfile";
inline constexpr const char* kOmitParameters = "_OmitSandboxParameters";
}  // namespace overlay

/// Keys of an entry of "conflicts".
namespace conflict {
inline constexpr const char* kBundleIdentifier = "bundle-identifier";
}  // namespace conflict

/// Keys of an annotation.
namespace annotation {
inline constexpr const char* kElection = "election";
inline constexpr const char* kExtension = "extension";
}  // namespace annotation

/// Entitlements: of managing clients, of restricted hosts, and of plug-ins.
namespace entitlement {
inline constexpr const char* kManager = "com.orbel.private.zorvan.manager";
inline constexpr const char* kAllowedPlugIns = "com.orbel.developer.zorvan.allowedplugins";
inline constexpr const char* kReplacePlugIn = "com.orbel.developer.replace-plugin";
inline constexpr const char* kAutoElectPlugIn = "com.orbel.developer.auto-elect-plugin";
}  // namespace entitlement

/// Posted when annotations (and with them match results) have changed.
inline constexpr const char* kAnnotationChangeNotification = "com.orbel.zorvan.annotation-change";

/// The preference domain with the user's choices about all plug-ins, and its key for the list of
/// rules that take plug-ins out of every discovery.
inline constexpr const char* kUserPreferences = "com.orbel.zorvan.userprefs";
inline constexpr const char* kExclusions = "exclusions";

/// The preference domain with the administrator's limits of plug-ins (docs/security.md).
inline constexpr const char* kLimitPreferences = "com.orbel.zorvan.limits";

}  // namespace zorvan
