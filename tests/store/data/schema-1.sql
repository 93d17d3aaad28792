CREATE TABLE relay_sessions(
  id INTEGER PRIMARY KEY, time REAL NOT NULL, session_id INTEGER NOT NULL, client_type INTEGER, client_version REAL,
  client_name TEXT, service_name TEXT, batch_event INTEGER, contains_realtime_events INTEGER, user_info TEXT NOT NULL);
CREATE TABLE relay_messages(
  id INTEGER PRIMARY KEY, time REAL NOT NULL, relay_session INTEGER NOT NULL, category INTEGER NOT NULL,
  type INTEGER NOT NULL, payload TEXT NOT NULL);
CREATE TABLE analytics_events(
  id INTEGER PRIMARY KEY, time REAL NOT NULL, name TEXT NOT NULL, payload TEXT NOT NULL);
CREATE TABLE power_records(
  id INTEGER PRIMARY KEY, time REAL NOT NULL, client_identifier INTEGER NOT NULL, name TEXT NOT NULL,
  record TEXT NOT NULL);
CREATE TABLE store_ledger(
  id INTEGER PRIMARY KEY, time REAL NOT NULL, event TEXT NOT NULL, table_name TEXT, rows INTEGER, detail TEXT);
CREATE VIEW session_messages AS
  SELECT m.id, datetime(m.time, 'unixepoch', 'localtime') AS at, s.session_id, s.service_name,
         json_extract(s.user_info, '$.HostApplicationDisplayID') AS application, m.category, m.type, m.payload
  FROM relay_messages m JOIN relay_sessions s ON s.id = m.relay_session;
CREATE VIEW client_uptimes AS
  SELECT id, datetime(time, 'unixepoch', 'localtime') AS at, json_extract(payload, '$.processName') AS process,
         json_extract(payload, '$.seconds') AS seconds
  FROM analytics_events WHERE name = 'com.quorvel.sonik.vxreportingclientuptime';
INSERT INTO relay_sessions VALUES(1,100.5,1,19,2.0,'com.quorvel.sonik','telephony_session',1,0,'{"HostApplicationDisplayID":"a"}');
INSERT INTO relay_messages VALUES(1,101.5,1,3,4,'{"x":1,"t":true}');
INSERT INTO analytics_events VALUES(3,101.5,'com.quorvel.sonik.Playback.Error','{"x":1,"t":true,"HostApplicationDisplayID":"a"}');
INSERT INTO analytics_events VALUES(7,102.5,'com.quorvel.sonik.vxreportingclientuptime','{"processName":"p","seconds":0.5}');
INSERT INTO analytics_events VALUES(9,103.5,'com.quorvel.sonik.Playback.Error','{"x":2}');
INSERT INTO power_records VALUES(1,104.5,28,'n','{"i":1}');
INSERT INTO store_ledger VALUES(1,105.5,'removed_for_age','power_records',2,'older than 30 days');
PRAGMA user_version = 1;
