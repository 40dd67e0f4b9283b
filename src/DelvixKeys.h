#pragma once
// The plug-in's key vocabulary: command names, return codes and the keys of every parameter
// map that crosses a boundary (requests, replies, search records, case records, bookmark
// requests, configuration-service messages). Every source file includes this header and, by
// `static`, holds its own copy of each constant, built at library load and freed at unload.

#include <QString>

// Commands accepted by Request.
static const QString CMD_START_SEARCH = QStringLiteral("startSearch");
static const QString CMD_STOP_SEARCH = QStringLiteral("stopSearch");
static const QString CMD_START_REID_SEARCH = QStringLiteral("startReIdSearch");
static const QString CMD_STOP_REID_SEARCH = QStringLiteral("stopReIdSearch");
static const QString CMD_RETRIEVE_DELVIX_DATA = QStringLiteral("retrieveDelvixData");
static const QString CMD_ADD_CASE_WITH_ITEM = QStringLiteral("addCaseWithItem");
static const QString CMD_ADD_CASE_ITEM = QStringLiteral("addCaseItem");
static const QString CMD_ADD_CASE_WITH_RECORDINGS = QStringLiteral("addCaseWithRecordings");
static const QString CMD_ADD_CASE_ITEM_FROM_RECORDINGS = QStringLiteral("addCaseItemFromRecordings");
static const QString CMD_UPDATE_CASE = QStringLiteral("updateCase");
static const QString CMD_DELETE_CASE = QStringLiteral("deleteCase");
static const QString CMD_GET_CASE_LIST = QStringLiteral("getCaseList");
static const QString CMD_RETRIEVE_CASE_MODEL = QStringLiteral("retrieveCaseModel");
static const QString CMD_RETRIEVE_CASE_ITEM_MODEL = QStringLiteral("retrieveCaseItemModel");

// Return codes of the reply callback.
static const QString RC_SUCCESS = QStringLiteral("0");
static const QString RC_FAILURE = QStringLiteral("-1");
static const QString RC_PARTIAL_FAILURE = QStringLiteral("-2");
static const QString RC_CASE_NOT_FOUND = QStringLiteral("-3");
static const QString RC_COMMAND_NOT_SUPPORTED = QStringLiteral("commandNotSupportError");

// Search period, places and conditions.
static const QString KEY_START_TIMESTAMP = QStringLiteral("startTimestamp");
static const QString KEY_END_TIMESTAMP = QStringLiteral("endTimestamp");
static const QString KEY_LOC_ID_LIST = QStringLiteral("locIDList");
static const QString KEY_HUMAN_INFO = QStringLiteral("humanInfo");
static const QString KEY_VEHICLE_INFO = QStringLiteral("vehicleInfo");
static const QString KEY_PLATE_NUMBER = QStringLiteral("plateNumber");
static const QString KEY_RULE_INFO = QStringLiteral("ruleInfo");
static const QString KEY_TYPE = QStringLiteral("type");
static const QString KEY_TRACE = QStringLiteral("trace");
static const QString KEY_DURATION = QStringLiteral("duration");
static const QString KEY_DIRECTION = QStringLiteral("direction");
static const QString KEY_LINE_CROSSING = QStringLiteral("lineCrossing");
static const QString KEY_LOITERING = QStringLiteral("loitering");
static const QString KEY_DESCENDING = QStringLiteral("descending");
static const QString KEY_DO_NOT_SORT = QStringLiteral("doNotSort");

// Re-identification.
static const QString KEY_FEATURE = QStringLiteral("feature");
static const QString KEY_FACE_FEATURE = QStringLiteral("faceFeature");
static const QString KEY_SCORE = QStringLiteral("score");
static const QString KEY_FACE_SCORE = QStringLiteral("faceScore");

// Search record.
static const QString KEY_OBJECT_ID = QStringLiteral("objectID");
static const QString KEY_OBJ_TYPE = QStringLiteral("objType");
static const QString KEY_LOC_ID = QStringLiteral("locID");
static const QString KEY_OBJ_IMAGE = QStringLiteral("objImage");
static const QString KEY_FACE_IMAGE = QStringLiteral("faceImage");
static const QString KEY_PLATE_IMAGE = QStringLiteral("plateImage");
static const QString KEY_TRAJECTORY = QStringLiteral("trajectory");
static const QString KEY_OBJECT_AGE = QStringLiteral("objectAge");
static const QString KEY_OBJECT_GENDER = QStringLiteral("objectGender");
static const QString KEY_OBJECT_ACCESSORIES = QStringLiteral("objectAccessories");
static const QString KEY_OBJECT_UPPER_COLOR = QStringLiteral("objectUpperColor");
static const QString KEY_OBJECT_LOWER_COLOR = QStringLiteral("objectLowerColor");
static const QString KEY_OBJECT_VEHICLE_COLOR = QStringLiteral("objectVehicleColor");
static const QString KEY_OBJECT_VEHICLE_TYPE = QStringLiteral("objectVehicleType");
static const QString KEY_NODE_ID = QStringLiteral("nodeID");

// Case and case item.
static const QString KEY_CASE_ID = QStringLiteral("caseId");
static const QString KEY_CASE_NAME = QStringLiteral("caseName");
static const QString KEY_CASE_NUMBER = QStringLiteral("caseNumber");
static const QString KEY_REPORTER = QStringLiteral("reporter");
static const QString KEY_DESCRIPTION = QStringLiteral("description");
static const QString KEY_CREATED_TIME = QStringLiteral("createdTime");
static const QString KEY_COVER_IMAGE = QStringLiteral("coverImage");
static const QString KEY_CASE_ITEM = QStringLiteral("caseItem");
static const QString KEY_CASE_ITEM_TYPE = QStringLiteral("caseItemType");
static const QString KEY_ID = QStringLiteral("id");
static const QString KEY_PREVIEW_IMAGE = QStringLiteral("previewImage");
static const QString KEY_COMMENT = QStringLiteral("comment");
static const QString KEY_EMAP_IMAGE_SCALE = QStringLiteral("emapImageScale");
static const QString KEY_EMAP_ANGLE = QStringLiteral("emapAngle");
static const QString KEY_SHOW_FACE_PHOTO_ON_REPORT = QStringLiteral("showFacePhotoOnReport");
static const QString KEY_SHOW_OBJECT_PHOTO_ON_REPORT = QStringLiteral("showObjectPhotoOnReport");
static const QString KEY_NEED_BOOKMARK = QStringLiteral("needBookmark");
static const QString KEY_BOOKMARK_ID = QStringLiteral("bookmarkId");
static const QString KEY_CASE_INFO_MAP = QStringLiteral("caseInfoMap");
static const QString KEY_CASE_ITEM_LIST = QStringLiteral("caseItemList");

// Bookmark request and answer.
static const QString KEY_BM_CAMERA_ID = QStringLiteral("CameraID");
static const QString KEY_BM_LOCATION_ID = QStringLiteral("LocationID");
static const QString KEY_BM_START_TIMESTAMP = QStringLiteral("StartTimestamp");
static const QString KEY_BM_END_TIMESTAMP = QStringLiteral("EndTimestamp");
static const QString KEY_BM_DESCRIPTION = QStringLiteral("Description");
static const QString KEY_BM_CREATOR = QStringLiteral("Creator");
static const QString KEY_BM_GROUP = QStringLiteral("Group");
static const QString KEY_BM_BOOKMARK_ID = QStringLiteral("BookmarkID");

// Configuration-service messages.
static const QString NOVIR_GET_NODE_INFO = QStringLiteral("GetNodeInfo");
static const QString NOVIR_QRY_LOCS = QStringLiteral("QryLocs");
static const QString NOVIR_SUB_CAM_STATUS = QStringLiteral("SubCamStatus");
static const QString NOVIR_CAM_INFO_CHANGE = QStringLiteral("CamInfoChange");
static const QString NOVIR_CAM_INS = QStringLiteral("CamIns");
static const QString NOVIR_CAM_RMV = QStringLiteral("CamRmv");
static const QString NOVIR_CHANNEL_ADD = QStringLiteral("ChannelAdd");
static const QString NOVIR_CHANNEL_RMV = QStringLiteral("ChannelRmv");
static const QString NOVIR_GET_NODE_INFO_BODY = QStringLiteral("<GetNodeInfo><Node>%1</Node></GetNodeInfo>");
static const QString NOVIR_GET_ALL_NODE_INFO_BODY =
    QStringLiteral("<GetNodeInfo><Node>__allcams__</Node></GetNodeInfo>");
static const QString NOVIR_QRY_LOCS_BODY = QStringLiteral("<QryLocs><LiveOnly>false</LiveOnly></QryLocs>");
static const QString NOVIR_SUB_CAM_STATUS_BODY = QStringLiteral("<SubCamStatus><SID>%1</SID></SubCamStatus>");

// Host plug-in identifiers.
static const QString PLUGIN_ID_SERVER_INFO = QStringLiteral("3CE573D25E0F455B8F75EDDC573E2B64");
static const QString PLUGIN_ID_BOOKMARK = QStringLiteral("2F6394EE90434A7190D7511370AFAE17");

// Installation directory of the object-metadata store (registry value).
static const QString KEY_INSTALL_PATH = QStringLiteral("INSTALL_PATH");

// Case vault schema. Existing vault files were made by exactly these statements; keep them as
// they stand so that every file made before opens unchanged.
static const QString SQL_CREATE_CASE_TABLE = QStringLiteral(
    "CREATE TABLE IF NOT EXISTS \"Case\" (id INTEGER PRIMARY KEY AUTOINCREMENT,name TEXT,number TEXT,"
    "reporter TEXT,description TEXT,createdTime INTEGER);");
static const QString SQL_CREATE_CASE_ITEM_TABLE = QStringLiteral(
    "CREATE TABLE IF NOT EXISTS CaseItem (id INTEGER PRIMARY KEY AUTOINCREMENT,caseId INTEGER,startTime "
    "INTEGER,endTime INTEGER,itemType INT,nodeId TEXT,locationId TEXT,objectImage TEXT,trajectory "
    "TEXT,faceImage TEXT,previewImage TEXT,showFacePhotoOnReport INTEGER DEFAULT(1),showObjectPhotoOnReport "
    "INTEGER DEFAULT(1),comment TEXT DEFAULT(''),emapImageScale DOUBLE DEFAULT(-1),emapAngle DOUBLE "
    "DEFAULT(0),bookmarkId INTEGER,needBookmark BOOLEAN,FOREIGN KEY(`caseId`) REFERENCES `Case`(`id`) ON "
    "DELETE CASCADE);");

// Trajectory points of a search record.
static const QString KEY_X = QStringLiteral("x");
static const QString KEY_Y = QStringLiteral("y");

// Member names of the object-metadata store's thumbnail and attribute texts.
static const QString TAMSA_THUMBNAIL = QStringLiteral("Thumbnail");
static const QString TAMSA_FACE_THUMBNAIL = QStringLiteral("FaceThumbnail");
static const QString TAMSA_LICENSE_PLATE_THUMBNAIL = QStringLiteral("LicensePlateThumbnail");
static const QString TAMSA_IMAGE = QStringLiteral("image");
static const QString TAMSA_FEATURE = QStringLiteral("feature");
static const QString TAMSA_PLATE_NUMBER = QStringLiteral("PlateNumber");
static const QString TAMSA_FACE_DETECTION_INFO = QStringLiteral("face_detection_info");
static const QString TAMSA_DETECTION_INFO = QStringLiteral("detection_info");
static const QString TAMSA_FILTERED = QStringLiteral("filtered");
static const QString TAMSA_ATTR_AGE = QStringLiteral("Age");
static const QString TAMSA_ATTR_GENDER = QStringLiteral("Gender");
static const QString TAMSA_ATTR_ACCESSORIES = QStringLiteral("Accessories");
static const QString TAMSA_ATTR_UPPER_COLOR = QStringLiteral("UpperColor");
static const QString TAMSA_ATTR_LOWER_COLOR = QStringLiteral("LowerColor");
static const QString TAMSA_ATTR_COLOR = QStringLiteral("Color");
static const QString TAMSA_ATTR_TYPE = QStringLiteral("Type");
static const QString TAMSA_OBJECT_TYPE_HUMAN = QStringLiteral("Human");
static const QString TAMSA_OBJECT_TYPE_VEHICLE = QStringLiteral("Vehicle");
static const QString LOCATION_PREFIX = QStringLiteral("Loc");
