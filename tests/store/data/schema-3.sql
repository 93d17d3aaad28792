CREATE TABLE relay_sessions(
  id INTEGER PRIMARY KEY,
  time REAL NOT NULL,
  session_id INTEGER NOT NULL,
  client_type INTEGER,
  client_version REAL,
  client_name TEXT,
  service_name TEXT,
  batch_event INTEGER,
  contains_realtime_events INTEGER,
  user_info TEXT NOT NULL,
  call INTEGER,
  place INTEGER,
  uid INTEGER,
  ended_at REAL,
  ended_how TEXT);
CREATE TABLE relay_messages(
  id INTEGER PRIMARY KEY,
  time REAL NOT NULL,
  relay_session INTEGER NOT NULL,
  category INTEGER NOT NULL,
  type INTEGER NOT NULL,
  payload TEXT NOT NULL,
  call INTEGER,
  place INTEGER,
  uid INTEGER,
  event_name INTEGER,
  event_place INTEGER,
  event_microseconds INTEGER,
  event_tail TEXT);
CREATE TABLE power_records(
  id INTEGER PRIMARY KEY,
  time REAL NOT NULL,
  client_identifier INTEGER NOT NULL,
  name TEXT NOT NULL,
  record TEXT NOT NULL,
  call INTEGER,
  place INTEGER,
  uid INTEGER);
CREATE TABLE store_ledger(
  id INTEGER PRIMARY KEY,
  time REAL NOT NULL,
  event TEXT NOT NULL,
  table_name TEXT,
  rows INTEGER,
  detail TEXT);
CREATE TABLE event_names(id INTEGER PRIMARY KEY, name TEXT NOT NULL UNIQUE);
CREATE TABLE analytics_entries(
  id INTEGER PRIMARY KEY,
  time REAL NOT NULL,
  name INTEGER NOT NULL,
  message INTEGER,
  payload TEXT NOT NULL,
  call INTEGER,
  place INTEGER,
  uid INTEGER,
  relay_session INTEGER);
CREATE TABLE store_epochs(id INTEGER PRIMARY KEY, epoch BLOB NOT NULL,
  after_row INTEGER NOT NULL DEFAULT 0, after_power INTEGER NOT NULL DEFAULT 0, after_session INTEGER NOT NULL DEFAULT 0);
INSERT INTO store_epochs VALUES(1,X'03030303030303030303030303030303',0,0,0);
CREATE TABLE store_marks(id INTEGER PRIMARY KEY, call INTEGER NOT NULL, last_row INTEGER NOT NULL);
CREATE VIEW session_messages AS
  SELECT m.id, datetime(m.time, 'unixepoch', 'localtime') AS at, s.session_id, s.service_name,
         json_extract(s.user_info, '$.HostApplicationDisplayID') AS application, m.category, m.type, m.payload
  FROM relay_messages m JOIN relay_sessions s ON s.id = m.relay_session;
CREATE VIEW analytics_events AS
  SELECT m.id, m.time + m.event_microseconds / 1e6 AS time,
         (SELECT n.name FROM event_names n WHERE n.id = m.event_name) AS name,
         substr(m.payload, 1, length(m.payload) - 1) || m.event_tail AS payload, m.relay_session
  FROM relay_messages m WHERE m.event_name IS NOT NULL
  UNION ALL
  SELECT e.id, e.time, (SELECT n.name FROM event_names n WHERE n.id = e.name) AS name,
         CASE WHEN e.message IS NULL THEN e.payload
              ELSE (SELECT substr(m.payload, 1, length(m.payload) - 1) FROM relay_messages m WHERE m.id = e.message)
                   || e.payload END AS payload, e.relay_session
  FROM analytics_entries e;
CREATE VIEW client_uptimes AS
  SELECT id, datetime(time, 'unixepoch', 'localtime') AS at, json_extract(payload, '$.processName') AS process,
         json_extract(payload, '$.seconds') AS seconds
  FROM analytics_events WHERE name = 'com.quorvel.sonik.vxreportingclientuptime';
INSERT INTO relay_sessions VALUES(1,100.5,1,19,2.0,'com.quorvel.sonik','telephony_session',1,0,'{"HostApplicationDisplayID":"a"}',1,0,1000,110.5,'stopped');
INSERT INTO relay_messages VALUES(1,101.5,1,3,4,'{"x":1,"t":true}',2,0,1000,NULL,NULL,NULL,NULL);
INSERT INTO relay_messages VALUES(3,102.5,1,3,4,'{"x":2}',3,0,1000,1,1,0,',"HostApplicationDisplayID":"a"}');
INSERT INTO event_names VALUES(1,'com.quorvel.sonik.Playback.Error');
INSERT INTO event_names VALUES(2,'com.quorvel.sonik.vxreportingclientuptime');
INSERT INTO analytics_entries VALUES(7,102.5,2,NULL,'{"processName":"p","seconds":0.5}',4,0,1000,NULL);
INSERT INTO analytics_entries VALUES(9,103.5,1,NULL,'{"left_out_bytes":300031}',5,0,1000,1);
INSERT INTO power_records VALUES(1,104.5,28,'n','{"i":1}',6,0,1000);
INSERT INTO store_ledger VALUES(1,105.5,'left_out','analytics_events',1,'a payload of 300031 bytes');
PRAGMA user_version = 3;
